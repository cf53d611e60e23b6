#include "portmanager/UpnpDetector.h"

namespace portmanager {

UpnpDetector::~UpnpDetector() {
    {
        std::lock_guard<std::mutex> lock(m_postLock);
        m_closing = true;
    }
    m_thread.Stop();
}

HRESULT UpnpDetector::Start(platform::WindowHandle window, platform::UINT message,
                            platform::WPARAM parameter) {
    if (window == nullptr) {
        return E_INVALIDARG;
    }
    {
        std::lock_guard<std::mutex> lock(m_postLock);
        if (m_running) {
            return S_OK;
        }
        m_running = true;
    }
    // A finished detection has posted already; all its thread has left to do is return.
    m_thread.Join();
    m_notifyWindow = window;
    m_notifyMessage = message;
    m_notifyParameter = parameter;
    if (!m_thread.Start([this] { DetectThread(); })) {
        // The owner waits for this message before it goes on: without a thread, report no
        // gateway so that it falls back to STUN.
        Finish(false);
    }
    return S_OK;
}

void UpnpDetector::DetectThread() {
    Finish(m_probe.GatewayPresent());
}

void UpnpDetector::Finish(bool found) {
    std::lock_guard<std::mutex> lock(m_postLock);
    if (m_closing) {
        return;
    }
    // Stored before the post, so the window handler reads this detection's outcome.
    m_found.store(found);
    m_running = false;
    platform::PostMessage(m_notifyWindow, m_notifyMessage, m_notifyParameter, 0);
}

}  // namespace portmanager
