// What the client should do after a discovery: which SIP server, whether UPnP, which addresses,
// whether to use the port manager; and the remote endpoints of its media mappings.
#include "foundation/Logger.h"
#include "portmanager/AdvancedPortManager.h"
#include "portmanager/BstrOut.h"
#include "stun/STUNResults.h"

namespace portmanager {

namespace {
bool HasText(const std::optional<std::string>& text) {
    return text && !text->empty();
}
}  // namespace

void CAdvancedPortManager::RecommendMediaProxy() {
    NQ_TRACE_ENTERED("CAdvancedPortManager::RecommendMediaProxy");
    m_topology = PMT_UNKNOWN;
    m_state = PMS_COMPLETED;
    m_recommendedUpnpEnabled = false;
    m_recommendedSipServer = m_mediaProxy;
    m_discoveryComplete = true;
    m_stunAddressesInUse = false;
    if (!HasText(m_privateIpAddress)) {
        const std::vector<uint32_t> local = m_monitor.GetLocalIPs();
        if (!local.empty()) {
            m_privateIpAddress = stun::FormatHostOrderAddress(local.front());
        }
    }
    m_publicIpAddress = m_privateIpAddress;
}

HRESULT CAdvancedPortManager::get_RecommendedPortManager(IUnknown** pVal) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::get_RecommendedPortManager");
    if (pVal == nullptr) {
        return E_POINTER;
    }
    if (m_discoveryComplete && HasText(m_privateIpAddress) && HasText(m_publicIpAddress)) {
        IAdvancedPortManager* self = this;
        self->AddRef();
        *pVal = self;
    } else {
        *pVal = nullptr;
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

HRESULT CAdvancedPortManager::UpdateRemoteAddress(LONG, LONG, LONG, LONG, LONG) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::UpdateRemoteAddress");
    return S_OK;
}

HRESULT CAdvancedPortManager::UpdateRemoteAddressEx(BSTR remoteAddress, LONG remotePort,
                                                    BSTR privateAddress, LONG privatePort,
                                                    BSTR publicAddress, LONG publicPort) {
    // A null address is taken as the empty one: its keep-alives then fail and are logged.
    const NetworkEndpoint publicEndpoint(Utf8FromBstr(publicAddress), publicPort);
    const NetworkEndpoint privateEndpoint(Utf8FromBstr(privateAddress), privatePort);
    const NetworkEndpoint remoteEndpoint(Utf8FromBstr(remoteAddress), remotePort);
    const PortMapping mapping(MappedServiceEndpoint(privateEndpoint, publicEndpoint),
                              remoteEndpoint);
    NQ_LOG("CAdvancedPortManager::UpdateRemoteAddressEx", foundation::kLogInfo, "%s",
           mapping.ToString().c_str());
    m_mediaMappings.push_back(mapping);
    mapping.Refresh();
    if (m_refreshTimerId != 0) {
        // A full keep-alive tick shortly; the tick itself goes back to the normal period.
        platform::SetTimer(Handle(), m_refreshTimerId, kEarlyKeepAliveMs);
    }
    return S_OK;
}

}  // namespace portmanager
