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

HRESULT CAdvancedPortManager::CreateInstance(IUnknown* outer, REFIID riid, void** ppv,
                                             PortManagerServices services) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    *ppv = nullptr;
    if (outer != nullptr && riid != IID_IUnknown) {
        return CLASS_E_NOAGGREGATION;
    }
    auto* object = new (std::nothrow) CAdvancedPortManager(std::move(services), outer);
    if (object == nullptr) {
        return E_OUTOFMEMORY;
    }
    // Held through a failed construction or query; the caller's reference comes from the query.
    const ComPtr<IUnknown> inner(&object->m_inner);
    HRESULT hr = object->FinalConstruct();
    if (SUCCEEDED(hr)) {
        hr = inner->QueryInterface(riid, ppv);
    }
    return hr;
}

CAdvancedPortManager::CAdvancedPortManager(PortManagerServices services, IUnknown* outer)
    : m_controlling(outer != nullptr ? outer : &m_inner),
      m_services(std::move(services)),
      m_upnpDetector(*m_services.upnpProbe),
      m_monitor(*m_services.networkInfo) {
    UseTypeLibrary(m_services.typeLibrary);
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
    m_pStunResult.reset();
    m_profile.Close();
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

// IUnknown: every interface delegates to the controlling unknown.

HRESULT CAdvancedPortManager::QueryInterface(REFIID riid, void** ppv) {
    return m_controlling->QueryInterface(riid, ppv);
}

ULONG CAdvancedPortManager::AddRef() {
    return m_controlling->AddRef();
}

ULONG CAdvancedPortManager::Release() {
    return m_controlling->Release();
}

HRESULT CAdvancedPortManager::InnerUnknown::QueryInterface(REFIID riid, void** ppv) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    CAdvancedPortManager& o = owner;
    if (riid == IID_IUnknown) {
        *ppv = static_cast<IUnknown*>(this);
    } else if (riid == IID_IDispatch || riid == IID_IAdvancedPortManager) {
        *ppv = static_cast<IAdvancedPortManager*>(&o);
    } else if (riid == IID_ISupportErrorInfo) {
        *ppv = static_cast<ISupportErrorInfo*>(&o);
    } else if (riid == IID_IConnectionPointContainer) {
        *ppv = static_cast<IConnectionPointContainer*>(&o);
    } else if (riid == IID_IPortMappingProvider || riid == IID_IPortMappingProvider2) {
        *ppv = static_cast<IPortMappingProvider*>(&o);
    } else if (riid == IID_INqDiagnostics) {
        *ppv = static_cast<INqDiagnostics*>(&o);
    } else {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    // Through the interface handed out: the inner count for IUnknown, the controlling one else.
    static_cast<IUnknown*>(*ppv)->AddRef();
    return S_OK;
}

ULONG CAdvancedPortManager::InnerUnknown::AddRef() {
    return ++owner.m_refs;
}

ULONG CAdvancedPortManager::InnerUnknown::Release() {
    const ULONG left = --owner.m_refs;
    if (left == 0) {
        owner.m_refs =
            1;  // a reference taken and dropped during the final release must not recurse
        owner.FinalRelease();
        delete &owner;
    }
    return left;
}

HRESULT CAdvancedPortManager::InterfaceSupportsErrorInfo(REFIID riid) {
    return riid == IID_IAdvancedPortManager ? S_OK : S_FALSE;
}

// Connection points: exactly one, for _IAdvancedPortManagerEvents, which the object itself is.

HRESULT CAdvancedPortManager::EnumConnectionPoints(IEnumConnectionPoints** ppEnum) {
    std::vector<ComPtr<IConnectionPoint>> points;
    try {
        points.emplace_back(static_cast<IConnectionPoint*>(this));
    } catch (const std::bad_alloc&) {
        return E_OUTOFMEMORY;
    }
    return ConnectionPointsEnum::Create(std::move(points), ppEnum);
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
    return m_events.Advise(pUnkSink, pdwCookie);
}

HRESULT CAdvancedPortManager::Unadvise(DWORD dwCookie) {
    return m_events.Unadvise(dwCookie);
}

HRESULT CAdvancedPortManager::EnumConnections(IEnumConnections** ppEnum) {
    return m_events.EnumConnections(ppEnum);
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
