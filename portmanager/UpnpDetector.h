// Finds out, on a thread of its own, whether the network has a UPnP Internet gateway, and tells
// the port manager's window with one message when it knows.
#pragma once

#include <nqportmanager/com.h>

#include <atomic>
#include <mutex>

#include "platform/kernel.h"
#include "platform/message.h"
#include "platform/upnp.h"

namespace portmanager {

class UpnpDetector {
  public:
    // Asks probe, which outlives the detector.
    explicit UpnpDetector(platform::UpnpGatewayProbe& probe = platform::SystemUpnpGatewayProbe())
        : m_probe(probe) {}
    // Ends a detection still running (it gives up at its next chance, within about a second)
    // and waits for it; no message is posted once destruction has begun.
    virtual ~UpnpDetector();
    UpnpDetector(const UpnpDetector&) = delete;
    UpnpDetector& operator=(const UpnpDetector&) = delete;

    // E_INVALIDARG for a null window. While a detection runs, S_OK and nothing else: its
    // message is still to come. Otherwise starts a new detection that posts (message,
    // parameter, 0) to the window once it knows, and returns S_OK. So every S_OK is followed by
    // exactly one message.
    HRESULT Start(platform::WindowHandle window, platform::UINT message,
                  platform::WPARAM parameter);
    // The outcome of the last detection whose message was posted; false before.
    bool IsUpnpFound() const { return m_found.load(); }

  private:
    void DetectThread();
    // Reports the outcome unless the detector is being destroyed; ends the detection.
    void Finish(bool found);

    platform::UpnpGatewayProbe& m_probe;
    platform::WindowHandle m_notifyWindow = nullptr;
    platform::UINT m_notifyMessage = 0;
    platform::WPARAM m_notifyParameter = 0;
    std::atomic<bool> m_found{false};
    platform::Thread m_thread;

    // Orders the thread's post against Start and the destructor.
    std::mutex m_postLock;
    bool m_running = false;  // started and not yet posted
    bool m_closing = false;  // the destructor has begun
};

}  // namespace portmanager
