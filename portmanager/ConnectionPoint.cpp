#include "portmanager/ConnectionPoint.h"

#include <new>

namespace portmanager {

EventSinks::~EventSinks() {
    for (IUnknown* sink : m_slots) {
        if (sink != nullptr) {
            sink->Release();
        }
    }
}

HRESULT EventSinks::Advise(IUnknown* sink, DWORD* cookie) {
    if (sink == nullptr || cookie == nullptr) {
        return E_POINTER;
    }
    *cookie = 0;
    IUnknown* events = nullptr;
    if (FAILED(sink->QueryInterface(DIID__IAdvancedPortManagerEvents,
                                    reinterpret_cast<void**>(&events))) ||
        events == nullptr) {
        return CONNECT_E_CANNOTCONNECT;
    }
    for (size_t i = 0; i < m_slots.size(); ++i) {
        if (m_slots[i] == nullptr) {
            m_slots[i] = events;
            *cookie = static_cast<DWORD>(i + 1);
            return S_OK;
        }
    }
    try {
        m_slots.push_back(events);
    } catch (const std::bad_alloc&) {
        events->Release();
        return CONNECT_E_ADVISELIMIT;
    }
    *cookie = static_cast<DWORD>(m_slots.size());
    return S_OK;
}

HRESULT EventSinks::Unadvise(DWORD cookie) {
    if (cookie == 0 || cookie > m_slots.size() || m_slots[cookie - 1] == nullptr) {
        return CONNECT_E_NOCONNECTION;
    }
    IUnknown* sink = m_slots[cookie - 1];
    m_slots[cookie - 1] = nullptr;
    sink->Release();
    return S_OK;
}

size_t EventSinks::Connected() const {
    size_t n = 0;
    for (IUnknown* sink : m_slots) {
        n += sink != nullptr ? 1 : 0;
    }
    return n;
}

void EventSinks::Fire(PM_EVENT type, IDispatch* event) {
    const size_t n = m_slots.size();
    for (size_t i = 0; i < n; ++i) {
        // A sink may connect or disconnect others from inside Event: re-read every slot.
        if (i >= m_slots.size() || m_slots[i] == nullptr) {
            continue;
        }
        IUnknown* sink = m_slots[i];
        sink->AddRef();
        _IAdvancedPortManagerEvents* events = nullptr;
        if (SUCCEEDED(sink->QueryInterface(DIID__IAdvancedPortManagerEvents,
                                           reinterpret_cast<void**>(&events))) &&
            events != nullptr) {
            events->Event(type, event);
            events->Release();
        }
        sink->Release();
    }
}

}  // namespace portmanager
