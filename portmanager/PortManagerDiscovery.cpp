// Discovery: a UPnP search, then a STUN pass unless a gateway answers or the client disabled it,
// and what the client should then do (which SIP server, whether UPnP, which addresses, whether
// to use the port manager).
#include "foundation/Logger.h"
#include "portmanager/AdvancedPortManager.h"
#include "portmanager/BstrOut.h"

namespace portmanager {

namespace {
bool HasText(const std::optional<std::string>& text) {
    return text && !text->empty();
}
}  // namespace

HRESULT CAdvancedPortManager::Refresh() {
    // Before InitializeEx2 there is nothing to discover with, and a discovery would move the
    // state on so that the object could never be initialised.
    if (m_state == PMS_UNINITIALIZED) {
        return E_FAIL;
    }
    ResetRecommendations();
    if (!m_forceUpnpDisabled) {
        m_upnpDetector.Start(Handle(), WM_PM_UPNP_DETECTED, 0);
    } else if (!m_forceStunDisabled) {
        StartStunDiscovery();
    } else {
        Conclude(DiscoveryInput::Answer::NoDiscovery);
    }
    return S_OK;
}

void CAdvancedPortManager::StartStunDiscovery() {
    if (m_pStunResult && SUCCEEDED(m_pStunResult->Refresh())) {
        return;
    }
    // No service (after Shutdown) or one that cannot start: the discovery ends in the fall-back.
    Conclude(DiscoveryInput::Answer::NoDiscovery);
}

void CAdvancedPortManager::OnUpnpDetected() {
    NQ_TRACE_ENTERED("CAdvancedPortManager::OnUpnpDetected");
    Conclude(m_upnpDetector.IsUpnpFound() ? DiscoveryInput::Answer::UpnpGateway
                                          : DiscoveryInput::Answer::NoUpnpGateway);
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
    DiscoveryOutcome out = DecideDiscovery(Facts(DiscoveryInput::Answer::StunResults, &list));
    if (out.unknownStunResult) {
        NQ_LOG("CAdvancedPortManager::OnStunRefresh", foundation::kLogError,
               "pResult->stunResult = 0x%x", static_cast<unsigned>(*out.unknownStunResult));
    }
    Apply(std::move(out));
}

void CAdvancedPortManager::Conclude(DiscoveryInput::Answer answer) {
    Apply(DecideDiscovery(Facts(answer, nullptr)));
}

DiscoveryInput CAdvancedPortManager::Facts(DiscoveryInput::Answer answer,
                                           const stun::STUNResultList* stunResults) const {
    DiscoveryInput in;
    in.answer = answer;
    in.stunResults = stunResults;
    in.stunDisabled = m_forceStunDisabled;
    in.sipProxy = m_sipProxy;
    in.mediaProxy = m_mediaProxy;
    in.privateIp = m_privateIpAddress;
    in.publicIp = m_publicIpAddress;
    in.localIps = m_monitor.GetLocalIPs();
    return in;
}

void CAdvancedPortManager::Apply(DiscoveryOutcome out) {
    if (out.startStun) {
        StartStunDiscovery();
        return;
    }
    m_state = PMS_COMPLETED;
    m_discoveryComplete = true;
    m_topology = out.topology;
    m_recommendedUpnpEnabled = out.upnpEnabled;
    m_stunAddressesInUse = out.stunAddressesInUse;
    m_recommendedSipServer = std::move(out.sipServer);
    m_privateIpAddress = std::move(out.privateIp);
    m_publicIpAddress = std::move(out.publicIp);
    NotifyChange(PME_UPDATED);
}

void CAdvancedPortManager::ResetRecommendations() {
    m_state = PMS_INITIALIZING;
    m_topology = PMT_UNKNOWN;
    m_recommendedUpnpEnabled = false;
    m_recommendedSipServer.clear();
    m_discoveryComplete = false;
    m_stunAddressesInUse = false;
}

HRESULT CAdvancedPortManager::get_RecommendedPortManager(IUnknown** pVal) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::get_RecommendedPortManager");
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = nullptr;
    if (m_discoveryComplete && HasText(m_privateIpAddress) && HasText(m_publicIpAddress)) {
        return ComPtr<IUnknown>(static_cast<IAdvancedPortManager*>(this)).CopyTo(pVal);
    }
    return S_OK;
}

HRESULT CAdvancedPortManager::get_RecommendedSipServer(BSTR* pVal) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::get_RecommendedSipServer");
    return CopyBstrOut(m_recommendedSipServer, pVal);
}

HRESULT CAdvancedPortManager::get_RecommendedUpnpEnabled(VARIANT_BOOL* pVal) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::get_RecommendedUpnpEnabled");
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = m_recommendedUpnpEnabled ? VARIANT_TRUE : VARIANT_FALSE;
    return S_OK;
}

HRESULT CAdvancedPortManager::get_ClientNameSuffix(BSTR* pVal) {
    return CopyBstrOut(std::string(m_stunAddressesInUse ? "STUN" : ""), pVal);
}

HRESULT CAdvancedPortManager::get_PrivateIpAddress(BSTR* pVal) {
    return CopyBstrOut(m_privateIpAddress.value_or(""), pVal);
}

HRESULT CAdvancedPortManager::get_PublicIpAddress(BSTR* pVal) {
    return CopyBstrOut(m_publicIpAddress.value_or(""), pVal);
}

}  // namespace portmanager
