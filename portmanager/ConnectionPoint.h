// The sinks connected to the connection point of _IAdvancedPortManagerEvents: a growable array
// whose 1-based slot is the cookie. Firing calls every sink in slot order, synchronously.
#pragma once

#include <vector>

#include <nqportmanager/NqPortManager.h>

namespace portmanager {

class EventSinks {
  public:
    EventSinks() = default;
    ~EventSinks();
    EventSinks(const EventSinks&) = delete;
    EventSinks& operator=(const EventSinks&) = delete;

    // Queries the sink for the event interface and keeps that reference. A sink without it
    // gives CONNECT_E_CANNOTCONNECT; a failure to store it, CONNECT_E_ADVISELIMIT.
    HRESULT Advise(IUnknown* sink, DWORD* cookie);
    // CONNECT_E_NOCONNECTION for a cookie that names no live sink.
    HRESULT Unadvise(DWORD cookie);
    size_t Connected() const;

    // Calls Event on every sink that answers the event interface, in slot order. Sinks that
    // connect meanwhile beyond the slots present at the start are not called.
    void Fire(PM_EVENT type, IDispatch* event);

  private:
    std::vector<IUnknown*> m_slots;  // null where a sink disconnected
};

}  // namespace portmanager
