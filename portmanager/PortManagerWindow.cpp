// The hidden window of the port manager: discovery outcomes, timer ticks and network changes
// arrive here, on the client's thread, and become state, recommendations and events.
#include <algorithm>

#include "foundation/Logger.h"
#include "portmanager/AdvancedPortManager.h"
#include "portmanager/PortManagerUpdateEvent.h"
#include "stun/STUNResults.h"

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
    if (m_refreshSIP) {
        RefreshPortMappings(m_sipMappings);
    }
    RefreshPortMappings(m_mediaMappings);
}

void CAdvancedPortManager::OnUpnpDetected() {
    NQ_TRACE_ENTERED("CAdvancedPortManager::OnUpnpDetected");
    if (m_upnpDetector.IsUpnpFound()) {
        m_topology = PMT_UPNP_ENABLED_NAT_OR_FIREWALL;
        m_state = PMS_COMPLETED;
        m_recommendedUpnpEnabled = true;
        m_recommendedSipServer = m_sipProxy;
        m_discoveryComplete = true;
        m_stunAddressesInUse = false;
        NotifyChange(PME_UPDATED);
    } else if (m_forceStunDisabled) {
        RecommendMediaProxy();
        NotifyChange(PME_UPDATED);
    } else {
        StartStunDiscovery();
    }
}

void CAdvancedPortManager::OnStunRefresh() {
    NQ_TRACE_ENTERED("CAdvancedPortManager::OnStunRefresh");
    if (!m_pStunResult || !m_pStunResult->IsSTUNResultReady()) {
        return;  // after Shutdown, or a Refresh came in between: the next pass posts again
    }
    stun::STUNResultList list;
    if (!m_pStunResult->GetSTUNResult(&list)) {
        return;
    }
    const int32_t count = std::min<int32_t>(list.count, stun::kMaxSTUNResults);
    if (count <= 0) {
        RecommendMediaProxy();
        NotifyChange(PME_UPDATED);
        return;
    }
    // The least restrictive classified address: results run from open (1) to blocked (8), and
    // an unclassified first entry (0) stays the choice.
    const stun::STUNResultEntry* chosen = &list.entries[0];
    for (int32_t i = 1; i < count; ++i) {
        const auto r = static_cast<int8_t>(list.entries[i].stunResult);
        if (r != 0 && r < static_cast<int8_t>(chosen->stunResult)) {
            chosen = &list.entries[i];
        }
    }
    const uint8_t r = chosen->stunResult;
    switch (r) {
        case stun::STUN_RESULT_UNKNOWN:
            RecommendMediaProxy();
            break;
        case stun::STUN_RESULT_OPEN:
        case stun::STUN_RESULT_FULL_CONE_FIREWALL:
        case stun::STUN_RESULT_FULL_CONE_NAT:
        case stun::STUN_RESULT_RESTRICTED_CONE_NAT:
        case stun::STUN_RESULT_PORT_RESTRICTED_CONE_NAT:
            ApplyStunAddresses(*chosen);
            break;
        case stun::STUN_RESULT_SYMMETRIC_FIREWALL:
        case stun::STUN_RESULT_SYMMETRIC_NAT:
            ApplyStunAddresses(*chosen);
            RecommendMediaProxy();
            break;
        case stun::STUN_RESULT_BLOCKED:
            RecommendMediaProxy();
            break;
        default:
            ApplyStunAddresses(*chosen);
            NQ_LOG("CAdvancedPortManager::OnStunRefresh", foundation::kLogError,
                   "pResult->stunResult = 0x%x", static_cast<unsigned>(r));
            RecommendMediaProxy();
            break;
    }
    // Set last, so that the fall-back's PMT_UNKNOWN does not overwrite it.
    m_topology = r <= stun::STUN_RESULT_BLOCKED ? static_cast<PM_TOPOLOGY>(r) : PMT_UNKNOWN;
    NotifyChange(PME_UPDATED);
}

void CAdvancedPortManager::ApplyStunAddresses(const stun::STUNResultEntry& entry) {
    m_state = PMS_COMPLETED;
    m_privateIpAddress = stun::FormatHostOrderAddress(entry.localAddress);
    m_publicIpAddress = stun::FormatHostOrderAddress(entry.publicAddress);
    m_recommendedSipServer = m_sipProxy;
    m_recommendedUpnpEnabled = false;
    m_discoveryComplete = true;
    m_stunAddressesInUse = true;
}

void CAdvancedPortManager::NotifyChange(PM_EVENT type) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::NotifyChange");
    IPortManagerUpdateEvent* event = nullptr;
    if (FAILED(PortManagerUpdateEvent::Create(&event))) {
        return;
    }
    IAdvancedPortManager* self = nullptr;
    if (SUCCEEDED(QueryInterface(IID_IAdvancedPortManager, reinterpret_cast<void**>(&self)))) {
        IDispatch* dispatch = nullptr;
        if (SUCCEEDED(event->put_PortManager(self)) &&
            SUCCEEDED(event->QueryInterface(IID_IDispatch, reinterpret_cast<void**>(&dispatch)))) {
            m_sinks.Fire(type, dispatch);
            dispatch->Release();
        }
        self->Release();
    }
    event->Release();
}

}  // namespace portmanager
