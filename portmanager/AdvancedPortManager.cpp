#include "portmanager/AdvancedPortManager.h"

#include <new>

#include "foundation/Logger.h"
#include "foundation/LoggingControl.h"
#include "foundation/NetUtils.h"
#include "portmanager/BstrOut.h"

namespace portmanager {

namespace {
constexpr LONG kMinStartingPort = 1024;
constexpr LONG kMaxPort = 65534;
constexpr LONG kMaxNumberOfPorts = 1024;
constexpr LONG kMinRefreshInterval = 30000;
constexpr uint32_t kDiagnosableError = 0x80EE000Cu;
constexpr uint32_t kFirstDiagnosableRange = 0x80EF01F5u;
constexpr uint32_t kLastDiagnosableRange = 0x80EF02BBu;
}  // namespace

PortManagerServices PortManagerServices::Default() {
    PortManagerServices s;
    s.createStunService = [](const char* servers, platform::WindowHandle window,
                             platform::UINT message, platform::WPARAM wParam,
                             platform::NetworkInfo& networkInfo) {
        return std::unique_ptr<stun::ISTUNResult>(
            new (std::nothrow) stun::CSTUNResult(servers, window, message, wParam, networkInfo));
    };
    return s;
}

HRESULT CAdvancedPortManager::CreateInstance(REFIID riid, void** ppv,
                                             PortManagerServices services) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    *ppv = nullptr;
    auto* object = new (std::nothrow) CAdvancedPortManager(std::move(services));
    if (object == nullptr) {
        return E_OUTOFMEMORY;
    }
    object->AddRef();  // keeps it alive through a failed construction or query
    HRESULT hr = object->FinalConstruct();
    if (SUCCEEDED(hr)) {
        hr = object->QueryInterface(riid, ppv);
    }
    object->Release();
    return hr;
}

CAdvancedPortManager::CAdvancedPortManager(PortManagerServices services)
    : m_services(std::move(services)),
      m_upnpDetector(*m_services.upnpProbe),
      m_monitor(*m_services.networkInfo) {
    ResetToDefaults();
}

CAdvancedPortManager::~CAdvancedPortManager() = default;

HRESULT CAdvancedPortManager::FinalConstruct() {
    ResetToDefaults();
    if (!CreateMessageWindow()) {
        return E_FAIL;
    }
    m_workerWindow.store(Handle());
    return S_OK;
}

void CAdvancedPortManager::FinalRelease() {
    // The monitor's and the diagnostic threads post to the window: stop them before it goes.
    m_diagnosticRuns.StopAll();
    m_monitor.Stop();
    m_monitor.Unsubscribe(this);
    if (m_refreshTimerId != 0) {
        platform::KillTimer(Handle(), m_refreshTimerId);
        m_refreshTimerId = 0;
    }
    if (m_pStunResult) {
        m_pStunResult.reset();
    }
    m_sparePool.CloseFree();
    m_audioRtpPool.CloseFree();
    m_audioRtcpPool.CloseFree();
    m_videoRtpPool.CloseFree();
    m_videoRtcpPool.CloseFree();
    m_sipMappings.clear();
    m_mediaMappings.clear();
    m_workerWindow.store(nullptr);
    DestroyMessageWindow();
}

void CAdvancedPortManager::ResetToDefaults() {
    m_startingPort = 5004;
    m_numberOfPorts = 16;
    m_state = PMS_UNINITIALIZED;
    m_topology = PMT_UNKNOWN;
    m_forceUpnpDisabled = false;
    m_forceStunDisabled = false;
    m_stunAddressesInUse = false;
    m_recommendedUpnpEnabled = false;
    m_discoveryComplete = false;
    m_recommendedSipServer.clear();
    m_sipProxy.clear();
    m_mediaProxy.clear();
    m_refreshInterval = 30000;
    m_refreshAudio = true;
    m_refreshVideo = true;
    m_refreshSIP = true;
    m_refreshTimerId = 0;
}

void CAdvancedPortManager::ResetRecommendations() {
    m_state = PMS_INITIALIZING;
    m_topology = PMT_UNKNOWN;
    m_recommendedUpnpEnabled = false;
    m_recommendedSipServer.clear();
    m_discoveryComplete = false;
    m_stunAddressesInUse = false;
}

// IUnknown

HRESULT CAdvancedPortManager::QueryInterface(REFIID riid, void** ppv) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    if (riid == IID_IUnknown || riid == IID_IDispatch || riid == IID_IAdvancedPortManager) {
        *ppv = static_cast<IAdvancedPortManager*>(this);
    } else if (riid == IID_ISupportErrorInfo) {
        *ppv = static_cast<ISupportErrorInfo*>(this);
    } else if (riid == IID_IConnectionPointContainer) {
        *ppv = static_cast<IConnectionPointContainer*>(this);
    } else if (riid == IID_IPortMappingProvider || riid == IID_IPortMappingProvider2) {
        *ppv = static_cast<IPortMappingProvider*>(this);
    } else if (riid == IID_INqDiagnostics) {
        *ppv = static_cast<INqDiagnostics*>(this);
    } else {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    AddRef();
    return S_OK;
}

ULONG CAdvancedPortManager::AddRef() {
    return ++m_refs;
}

ULONG CAdvancedPortManager::Release() {
    const ULONG left = --m_refs;
    if (left == 0) {
        m_refs = 1;  // a reference taken and dropped during the final release must not recurse
        FinalRelease();
        delete this;
    }
    return left;
}

HRESULT CAdvancedPortManager::InterfaceSupportsErrorInfo(REFIID riid) {
    return riid == IID_IAdvancedPortManager ? S_OK : S_FALSE;
}

// Connection points: exactly one, for _IAdvancedPortManagerEvents, which the object itself is.

HRESULT CAdvancedPortManager::EnumConnectionPoints(IEnumConnectionPoints** ppEnum) {
    if (ppEnum != nullptr) {
        *ppEnum = nullptr;
    }
    return E_NOTIMPL;
}

HRESULT CAdvancedPortManager::FindConnectionPoint(REFIID riid, IConnectionPoint** ppCP) {
    if (ppCP == nullptr) {
        return E_POINTER;
    }
    if (riid != DIID__IAdvancedPortManagerEvents) {
        *ppCP = nullptr;
        return CONNECT_E_NOCONNECTION;
    }
    *ppCP = static_cast<IConnectionPoint*>(this);
    AddRef();
    return S_OK;
}

HRESULT CAdvancedPortManager::GetConnectionInterface(IID* pIID) {
    if (pIID == nullptr) {
        return E_POINTER;
    }
    *pIID = DIID__IAdvancedPortManagerEvents;
    return S_OK;
}

HRESULT CAdvancedPortManager::GetConnectionPointContainer(IConnectionPointContainer** ppCPC) {
    if (ppCPC == nullptr) {
        return E_POINTER;
    }
    *ppCPC = static_cast<IConnectionPointContainer*>(this);
    AddRef();
    return S_OK;
}

HRESULT CAdvancedPortManager::Advise(IUnknown* pUnkSink, DWORD* pdwCookie) {
    return m_sinks.Advise(pUnkSink, pdwCookie);
}

HRESULT CAdvancedPortManager::Unadvise(DWORD dwCookie) {
    return m_sinks.Unadvise(dwCookie);
}

HRESULT CAdvancedPortManager::EnumConnections(IEnumConnections** ppEnum) {
    if (ppEnum != nullptr) {
        *ppEnum = nullptr;
    }
    return E_NOTIMPL;
}

// Initialisation and life

HRESULT CAdvancedPortManager::InitializeEx(BSTR bstrStunServerName, LONG lStartingPort,
                                           LONG lNumberOfPorts, BSTR bstrSipProxy,
                                           BSTR bstrMediaProxy, VARIANT_BOOL vbForceUpnpDisabled,
                                           VARIANT_BOOL vbForceStunDisabled) {
    return InitializeEx2(bstrStunServerName, lStartingPort, lNumberOfPorts, bstrSipProxy,
                         bstrMediaProxy, vbForceUpnpDisabled, vbForceStunDisabled,
                         kMinRefreshInterval, VARIANT_TRUE, VARIANT_TRUE, VARIANT_TRUE);
}

HRESULT CAdvancedPortManager::InitializeEx2(BSTR bstrStunServerName, LONG lStartingPort,
                                            LONG lNumberOfPorts, BSTR bstrSipProxy,
                                            BSTR bstrMediaProxy, VARIANT_BOOL vbForceUpnpDisabled,
                                            VARIANT_BOOL vbForceStunDisabled, LONG lRefreshInterval,
                                            VARIANT_BOOL vbRefreshAudio,
                                            VARIANT_BOOL vbRefreshVideo,
                                            VARIANT_BOOL vbRefreshSIP) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::InitializeEx2");
    if (bstrStunServerName == nullptr) {
        return E_POINTER;
    }
    if (lStartingPort < kMinStartingPort || lStartingPort > kMaxPort ||
        lNumberOfPorts > kMaxNumberOfPorts ||
        static_cast<int64_t>(lStartingPort) + lNumberOfPorts > kMaxPort) {
        return E_INVALIDARG;
    }
    if (m_state != PMS_UNINITIALIZED) {
        return E_FAIL;
    }
    if (bstrSipProxy == nullptr || bstrMediaProxy == nullptr) {
        return E_POINTER;
    }
    if (lRefreshInterval < kMinRefreshInterval) {
        return E_INVALIDARG;
    }

    m_stunServer = Utf8FromBstr(bstrStunServerName);
    m_numberOfPorts = lNumberOfPorts;
    m_startingPort = lStartingPort;
    m_topology = PMT_UNKNOWN;
    m_sipProxy = Utf8FromBstr(bstrSipProxy);
    m_mediaProxy = Utf8FromBstr(bstrMediaProxy);
    m_forceUpnpDisabled = vbForceUpnpDisabled != VARIANT_FALSE;
    m_forceStunDisabled = vbForceStunDisabled != VARIANT_FALSE;
    m_refreshAudio = vbRefreshAudio != VARIANT_FALSE;
    m_refreshVideo = vbRefreshVideo != VARIANT_FALSE;
    m_refreshSIP = vbRefreshSIP != VARIANT_FALSE;
    m_refreshInterval = lRefreshInterval;
    m_state = PMS_INITIALIZING;

    m_monitor.Subscribe(this);
    m_monitor.Start();

    if (m_services.createStunService) {
        m_pStunResult = m_services.createStunService(
            m_stunServer->c_str(), Handle(), WM_PM_STUN_REFRESH, 0, *m_services.networkInfo);
    }
    Refresh();
    return S_OK;
}

HRESULT CAdvancedPortManager::Shutdown() {
    NQ_TRACE_ENTERED("CAdvancedPortManager::Shutdown");
    m_diagnosticRuns.StopAll();
    m_monitor.Stop();
    m_monitor.Unsubscribe(this);
    if (m_pStunResult) {
        m_pStunResult->Stop();
        m_pStunResult.reset();
    }
    return S_OK;
}

HRESULT CAdvancedPortManager::InitiateShutdown() {
    NQ_TRACE_ENTERED("CAdvancedPortManager::InitiateShutdown");
    platform::SetTimer(Handle(), SHUTDOWN_TIMER_ID, kShutdownTimerPeriodMs);
    return S_OK;
}

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
        RecommendMediaProxy();
        NotifyChange(PME_UPDATED);
    }
    return S_OK;
}

void CAdvancedPortManager::StartStunDiscovery() {
    if (m_pStunResult && SUCCEEDED(m_pStunResult->Refresh())) {
        return;
    }
    // No service (after Shutdown) or one that cannot start: the discovery ends in the fall-back.
    RecommendMediaProxy();
    NotifyChange(PME_UPDATED);
}

// Simple properties

HRESULT CAdvancedPortManager::get_StunServer(BSTR* pVal) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::get_StunServer");
    return CopyBstrOut(m_stunServer, pVal);
}

HRESULT CAdvancedPortManager::get_StartingPort(LONG* pVal) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::get_StartingPort");
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = m_startingPort;
    return S_OK;
}

HRESULT CAdvancedPortManager::get_NumberOfPorts(LONG* pVal) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::get_NumberOfPorts");
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = m_numberOfPorts;
    return S_OK;
}

HRESULT CAdvancedPortManager::get_State(PM_STATE* pVal) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::get_State");
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = m_state;
    return S_OK;
}

HRESULT CAdvancedPortManager::get_Topology(PM_TOPOLOGY* pVal) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::get_Topology");
    if (pVal == nullptr) {
        return E_POINTER;
    }
    *pVal = m_topology;
    return S_OK;
}

HRESULT CAdvancedPortManager::get_UDPPacketsIn(LONG* pVal) {
    if (pVal == nullptr) {
        return E_POINTER;
    }
    uint32_t count = 0;
    const int32_t hr = foundation::QueryUdpInDatagrams(&count, *m_services.networkInfo);
    if (FAILED(hr)) {
        return hr;
    }
    *pVal = static_cast<LONG>(count);
    return S_OK;
}

HRESULT CAdvancedPortManager::ErrorCanBeDiagnosed(LONG errorCode, VARIANT_BOOL* pVal) {
    if (pVal == nullptr) {
        return E_POINTER;
    }
    const auto code = static_cast<uint32_t>(errorCode);
    const bool diagnosable = code == kDiagnosableError ||
                             (code >= kFirstDiagnosableRange && code <= kLastDiagnosableRange);
    *pVal = diagnosable ? VARIANT_TRUE : VARIANT_FALSE;
    return S_OK;
}

// INqDiagnostics: one logger for the whole process.

HRESULT CAdvancedPortManager::get_LogLevel(INT* pLevel) {
    return foundation::GetLogLevel(pLevel);
}
HRESULT CAdvancedPortManager::put_LogLevel(INT level) {
    return foundation::PutLogLevel(level);
}
HRESULT CAdvancedPortManager::get_LogFolder(BSTR* p) {
    return foundation::GetLogFolder(p);
}
HRESULT CAdvancedPortManager::get_LogFilePrefix(BSTR* p) {
    return foundation::GetLogFilePrefix(p);
}
HRESULT CAdvancedPortManager::get_LogFileExtension(BSTR* p) {
    return foundation::GetLogFileExtension(p);
}
HRESULT CAdvancedPortManager::get_LoggingEnabled(VARIANT_BOOL* p) {
    return foundation::GetLoggingEnabled(p);
}
HRESULT CAdvancedPortManager::put_LoggingEnabled(VARIANT_BOOL enabled) {
    return foundation::PutLoggingEnabled(enabled);
}
HRESULT CAdvancedPortManager::InitializeLogging(BSTR bstrFolder, BSTR bstrPrefix, BSTR bstrExt,
                                                INT LogLevel, VARIANT_BOOL enabled) {
    return foundation::InitializeLogging(bstrFolder, bstrPrefix, bstrExt, LogLevel, enabled);
}
HRESULT CAdvancedPortManager::ShutdownLogging() {
    return foundation::ShutdownLogging();
}

// INetworkChangeSink: called on the monitor's thread, so only post.

void CAdvancedPortManager::OnLocalIPsChanged() {}

void CAdvancedPortManager::OnRouteChanged() {
    platform::PostMessage(m_workerWindow.load(), WM_PM_NETWORK_CHANGE, 0, 0);
}

}  // namespace portmanager
