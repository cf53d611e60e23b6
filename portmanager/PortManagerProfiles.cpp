// Enabling a calling profile: SIP mappings from the client's addresses, five pools of reserved
// media ports, the first keep-alives and the keep-alive timer; the mappings handed out and the
// media mappings the client registers for keep-alives.
#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <limits>

#include "foundation/Logger.h"
#include "portmanager/AdvancedPortManager.h"
#include "portmanager/BstrOut.h"

namespace portmanager {

namespace {

constexpr int32_t kClientDefaultPort = 0;
constexpr int32_t kSipServerDefaultPort = 5060;

// "address[:port]": split at the first colon; a port that is not a number counts as 0.
NetworkEndpoint ParseEndpointText(const std::string& text, int32_t defaultPort) {
    const auto colon = text.find(':');
    if (colon == std::string::npos) {
        return NetworkEndpoint(text, defaultPort);
    }
    const long port = std::strtol(text.c_str() + colon + 1, nullptr, 10);
    const long clamped = std::max<long>(std::numeric_limits<int32_t>::min(),
                                        std::min<long>(port, std::numeric_limits<int32_t>::max()));
    return NetworkEndpoint(text.substr(0, colon), static_cast<int32_t>(clamped));
}

// Writes the four out values, or none of them.
HRESULT WriteMapping(const MappedServiceEndpoint& m, BSTR* privateAddress, LONG* privatePort,
                     BSTR* publicAddress, LONG* publicPort) {
    BSTR priv = nullptr;
    BSTR pub = nullptr;
    if (FAILED(CopyBstrOut(m.m_private.m_address, &priv))) {
        return E_OUTOFMEMORY;
    }
    if (FAILED(CopyBstrOut(m.m_public.m_address, &pub))) {
        SysFreeString(priv);
        return E_OUTOFMEMORY;
    }
    *privateAddress = priv;
    *privatePort = m.m_private.m_port;
    *publicAddress = pub;
    *publicPort = m.m_public.m_port;
    return S_OK;
}

}  // namespace

HRESULT CAdvancedPortManager::OnBeforeEnableProfile(VARIANT networkAddresses, LONG minSipPort,
                                                    LONG maxSipPort, LONG, LONG, LONG, LONG, LONG,
                                                    LONG, LONG, LONG, LONG portsPerProtocol) {
    // The audio and video ranges are not used: every pool draws from the SIP range.
    return OnBeforeEnableProfileEx(networkAddresses, minSipPort, maxSipPort, portsPerProtocol,
                                   VARIANT_TRUE);
}

HRESULT CAdvancedPortManager::OnBeforeEnableProfileEx(VARIANT networkAddresses, LONG minPort,
                                                      LONG maxPort, LONG portsPerProtocol,
                                                      VARIANT_BOOL randomizePorts) {
    constexpr const char* kFunction = "CAdvancedPortManager::OnBeforeEnableProfileEx";
    NQ_TRACE_ENTERED(kFunction);
    if (m_refreshTimerId != 0) {
        return E_FAIL;
    }
    if (networkAddresses.vt != (VT_ARRAY | VT_BSTR)) {
        return E_INVALIDARG;
    }
    // A negative count would never be reached: the first pool would bind every port of its
    // parity in the range and keep them.
    if (portsPerProtocol < 0) {
        return E_INVALIDARG;
    }
    if (!m_discoveryComplete || !m_privateIpAddress || m_privateIpAddress->empty() ||
        !m_publicIpAddress || m_publicIpAddress->empty()) {
        return E_FAIL;
    }

    std::srand(static_cast<unsigned>(std::time(nullptr)));
    std::vector<PortMapping>& sipMappings = m_profile.Sip();
    sipMappings.clear();

    SAFEARRAY* array = networkAddresses.parray;
    if (array != nullptr && SafeArrayGetElemsize(array) > 0) {
        const std::string& privateAddress = *m_privateIpAddress;
        const NetworkEndpoint server =
            ParseEndpointText(m_recommendedSipServer, kSipServerDefaultPort);
        LONG lower = 0;
        SafeArrayGetLBound(array, 1, &lower);
        const ULONG count = array->rgsabound[0].cElements;
        for (ULONG i = 0; i < count; ++i) {
            LONG index = lower + static_cast<LONG>(i);
            BSTR element = nullptr;
            if (FAILED(SafeArrayGetElement(array, &index, &element))) {
                continue;
            }
            const NetworkEndpoint client =
                ParseEndpointText(Utf8FromBstr(element), kClientDefaultPort);
            SysFreeString(element);
            const NetworkEndpoint outside(*m_publicIpAddress, client.m_port);
            const PortMapping mapping(MappedServiceEndpoint(client, outside), server);
            if (client.m_address == privateAddress) {
                NQ_LOG(kFunction, foundation::kLogInfo, "Adding SIP Port Mapping for %s",
                       mapping.ToString().c_str());
                sipMappings.push_back(mapping);
            }
        }
    } else {
        NQ_LOG(kFunction, foundation::kLogError, "%s",
               "Failed Assertion - networkAddresses.vt == (VT_ARRAY|VT_BSTR) && "
               "networkAddresses.parray->cbElements > 0");
    }
    if (sipMappings.empty()) {
        return E_FAIL;
    }

    const MappedServiceEndpoint& first = sipMappings.front().m_local;
    if (!m_profile.FillPools(static_cast<uint32_t>(portsPerProtocol), minPort, maxPort,
                             first.m_private.m_address, first.m_public.m_address,
                             randomizePorts != VARIANT_FALSE)) {
        return E_FAIL;
    }
    m_profile.DumpPools();
    RefreshPortMappings(sipMappings);
    m_refreshTimerId =
        platform::SetTimer(Handle(), REFRESH_TIMER_ID, static_cast<uint32_t>(m_refreshInterval));
    return S_OK;
}

HRESULT CAdvancedPortManager::OnBeforeDisableProfile() {
    NQ_TRACE_ENTERED("CAdvancedPortManager::OnBeforeDisableProfile");
    if (m_refreshTimerId != 0) {
        platform::KillTimer(Handle(), m_refreshTimerId);
        m_refreshTimerId = 0;
    }
    return S_OK;
}

HRESULT CAdvancedPortManager::GetMapping(BSTR, LONG type, BSTR* privateAddress, LONG* privatePort,
                                         BSTR* publicAddress, LONG* publicPort) {
    constexpr const char* kFunction = "CAdvancedPortManager::GetMapping";
    NQ_TRACE_ENTERED(kFunction);
    if (privateAddress == nullptr || privatePort == nullptr || publicAddress == nullptr ||
        publicPort == nullptr) {
        return E_POINTER;
    }
    if (!m_pStunResult) {
        NQ_LOG(kFunction, foundation::kLogError, "%s", "Failed Assertion - m_pStunResult != NULL");
        return E_FAIL;
    }
    if (type == SIP) {
        if (m_profile.Sip().empty()) {
            NQ_LOG(kFunction, foundation::kLogError, "%s",
                   "Failed Assertion - !m_sipMappings.empty()");
            return E_FAIL;
        }
        return WriteMapping(m_profile.Sip().front().m_local, privateAddress, privatePort,
                            publicAddress, publicPort);
    }
    PortMappingPool* found = m_profile.MediaPool(type);
    if (found == nullptr) {
        return S_OK;
    }
    PortMappingPool& pool = *found;
    if (pool.Free().empty()) {
        NQ_LOG(kFunction, foundation::kLogError, "%s", "Failed Assertion - !m_free.empty()");
        return E_FAIL;
    }
    MappedServiceEndpoint mapping;
    pool.GetMapping(mapping);
    const HRESULT hr =
        WriteMapping(mapping, privateAddress, privatePort, publicAddress, publicPort);
    if (FAILED(hr)) {
        pool.ReleaseMapping(mapping);  // nothing reached the caller: keep the port reserved
    }
    return hr;
}

HRESULT CAdvancedPortManager::ReleaseMapping(BSTR privateAddress, LONG privatePort,
                                             BSTR publicAddress, LONG publicPort) {
    constexpr const char* kFunction = "CAdvancedPortManager::ReleaseMapping";
    NQ_TRACE_ENTERED(kFunction);
    MappedServiceEndpoint m(NetworkEndpoint(Utf8FromBstr(privateAddress), privatePort),
                            NetworkEndpoint(Utf8FromBstr(publicAddress), publicPort));
    const std::string text = m.ToString();
    const MappedServiceEndpoint original = m;  // the pool's re-bind may change m's ports
    std::string sipText;
    switch (m_profile.ReleaseToPool(m, sipText)) {
        case ProfileMappings::Released::Sip:
            NQ_LOG(kFunction, foundation::kLogError, "MappedServiceEndpoint is SIP - %s",
                   sipText.c_str());
            return S_OK;
        case ProfileMappings::Released::NotInPool:
            NQ_LOG(kFunction, foundation::kLogError,
                   "MappedServiceEndpoint not found in mapping pool - %s", text.c_str());
            break;
        case ProfileMappings::Released::FromPool:
            break;
    }
    if (m_profile.RemoveMedia(original)) {
        return S_OK;
    }
    NQ_LOG(kFunction, foundation::kLogError, "MappedServiceEndpoint not found in media pool - %s",
           text.c_str());
    return E_FAIL;
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
    m_profile.AddMedia(mapping);
    mapping.Refresh();
    if (m_refreshTimerId != 0) {
        // A full keep-alive tick shortly; the tick itself goes back to the normal period.
        platform::SetTimer(Handle(), m_refreshTimerId, kEarlyKeepAliveMs);
    }
    return S_OK;
}

}  // namespace portmanager
