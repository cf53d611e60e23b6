// The hidden window of the port manager: discovery outcomes, timer ticks and network changes
// arrive here, on the client's thread, and become state, recommendations and events.
#include "foundation/Logger.h"
#include "portmanager/AdvancedPortManager.h"
#include "portmanager/PortManagerUpdateEvent.h"

namespace portmanager {

platform::LRESULT CAdvancedPortManager::WindowProc(platform::UINT message, platform::WPARAM wParam,
                                                   platform::LPARAM, bool& handled) {
    // A handler may drop the client's last reference (from inside an event, say).
    AddRef();
    handled = true;
    switch (message) {
        case WM_PM_STUN_REFRESH:
            OnStunRefresh();
            break;
        case WM_PM_UPNP_DETECTED:
            OnUpnpDetected();
            break;
        case platform::WM_TIMER:
            OnTimer(wParam);
            break;
        case WM_PM_NETWORK_CHANGE:
            NotifyChange(PME_NETWORK_CHANGE);
            break;
        case WM_PM_DIAGNOSTIC_COMPLETE:
            OnDiagnosticComplete(wParam);
            break;
        default:
            handled = false;
            break;
    }
    Release();
    return 0;
}

void CAdvancedPortManager::OnTimer(uintptr_t timerId) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::OnTimer");
    if (timerId == SHUTDOWN_TIMER_ID) {
        // The shutdown the client announced: tell its sinks once, then stop ticking.
        platform::KillTimer(Handle(), SHUTDOWN_TIMER_ID);
        NotifyChange(PME_SHUTDOWN);
        return;
    }
    if (timerId != REFRESH_TIMER_ID) {
        return;
    }
    if (m_refreshTimerId != 0) {
        platform::SetTimer(Handle(), m_refreshTimerId, kKeepAlivePeriodMs);
    }
    m_profile.Refresh(m_refreshSIP);
}

void CAdvancedPortManager::NotifyChange(PM_EVENT type) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::NotifyChange");
    ComPtr<IPortManagerUpdateEvent> event;
    ComPtr<IDispatch> dispatch;
    if (FAILED(PortManagerUpdateEvent::Create(event.GetAddressOf(), m_services.typeLibrary)) ||
        FAILED(event->put_PortManager(this)) || FAILED(event.As(&dispatch))) {
        return;
    }
    m_events.Fire([&](_IAdvancedPortManagerEvents* sink) { sink->Event(type, dispatch.Get()); });
}

}  // namespace portmanager
