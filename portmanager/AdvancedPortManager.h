// The port manager the client creates and drives: discovery of the path to the Internet (UPnP
// gateway or STUN classification, in the background), the resulting recommendations, port
// mappings with keep-alives, and events to the client's sinks.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <nqportmanager/NqPortManager.h>

#include "diagnostics/DiagnosticRun.h"
#include "foundation/NetworkChangeMonitor.h"
#include "platform/message.h"
#include "platform/modulelock.h"
#include "platform/netinfo.h"
#include "platform/upnp.h"
#include "portmanager/ConnectionPoint.h"
#include "portmanager/DiscoveryDecision.h"
#include "portmanager/Dispatch.h"
#include "portmanager/ProfileMappings.h"
#include "portmanager/UpnpDetector.h"
#include "stun/STUNResult.h"

namespace portmanager {

inline constexpr platform::UINT WM_PM_STUN_REFRESH = platform::WM_USER + 123;
inline constexpr platform::UINT WM_PM_UPNP_DETECTED = platform::WM_USER + 124;
inline constexpr platform::UINT WM_PM_NETWORK_CHANGE = platform::WM_USER + 125;
inline constexpr platform::UINT WM_PM_DIAGNOSTIC_COMPLETE = platform::WM_USER + 126;
inline constexpr uintptr_t REFRESH_TIMER_ID = 1234;
inline constexpr uintptr_t SHUTDOWN_TIMER_ID = 1000;
inline constexpr uint32_t kShutdownTimerPeriodMs = 1000;
inline constexpr uint32_t kKeepAlivePeriodMs = 30000;
inline constexpr uint32_t kEarlyKeepAliveMs = 200;

// What the port manager builds on, replaceable where a test must control the answers. The
// system's by default; whatever is given outlives the port manager.
struct PortManagerServices {
    // Addresses, gateways and the UDP counter, for the port manager and its STUN service.
    platform::NetworkInfo* networkInfo = &platform::SystemNetworkInfo();
    platform::UpnpGatewayProbe* upnpProbe = &platform::SystemUpnpGatewayProbe();
    // The interface toward an address, for the diagnostic runs.
    platform::RouteLookup* routeLookup = &platform::SystemRouteLookup();
    // Empty: no STUN service. Default() creates the real one.
    std::function<std::unique_ptr<stun::ISTUNResult>(const char* servers, platform::WindowHandle,
                                                     platform::UINT, platform::WPARAM,
                                                     platform::NetworkInfo&)>
        createStunService;
    // The type information IDispatch is served from (the module's library); null: none.
    ITypeLib* typeLibrary = nullptr;

    static PortManagerServices Default();
};

// The COM identity, its connection point and its hidden window. The discovery and its
// recommendations live in PortManagerDiscovery.cpp (the decision itself in DiscoveryDecision),
// the profile's mappings in PortManagerProfiles.cpp (held by ProfileMappings), the window's
// messages and the events in PortManagerWindow.cpp.
class CAdvancedPortManager final : public ISupportErrorInfo,
                                   public IConnectionPointContainer,
                                   public IConnectionPoint,
                                   public TypeInfoDispatch<IAdvancedPortManager>,
                                   public IPortMappingProvider,
                                   public platform::MessageWindow,
                                   public INqDiagnostics,
                                   public foundation::INetworkChangeSink {
  public:
    // Creates the object (hidden window included) on the calling thread and returns the asked
    // interface. E_FAIL when the window cannot be created. With an outer object the port manager
    // is aggregated: only IID_IUnknown may be asked (else CLASS_E_NOAGGREGATION), the outer gets
    // the inner, non-delegating IUnknown, and every other interface delegates to the outer.
    static HRESULT CreateInstance(IUnknown* outer, REFIID riid, void** ppv,
                                  PortManagerServices services = PortManagerServices::Default());
    static HRESULT CreateInstance(REFIID riid, void** ppv,
                                  PortManagerServices services = PortManagerServices::Default()) {
        return CreateInstance(nullptr, riid, ppv, std::move(services));
    }

    // IUnknown
    HRESULT QueryInterface(REFIID riid, void** ppv) override;
    ULONG AddRef() override;
    ULONG Release() override;

    // ISupportErrorInfo
    HRESULT InterfaceSupportsErrorInfo(REFIID riid) override;

    // IConnectionPointContainer
    HRESULT EnumConnectionPoints(IEnumConnectionPoints** ppEnum) override;
    HRESULT FindConnectionPoint(REFIID riid, IConnectionPoint** ppCP) override;

    // IConnectionPoint (for _IAdvancedPortManagerEvents)
    HRESULT GetConnectionInterface(IID* pIID) override;
    HRESULT GetConnectionPointContainer(IConnectionPointContainer** ppCPC) override;
    HRESULT Advise(IUnknown* pUnkSink, DWORD* pdwCookie) override;
    HRESULT Unadvise(DWORD dwCookie) override;
    HRESULT EnumConnections(IEnumConnections** ppEnum) override;

    // IAdvancedPortManager
    HRESULT Shutdown() override;
    HRESULT InitializeEx(BSTR bstrStunServerName, LONG lStartingPort, LONG lNumberOfPorts,
                         BSTR bstrSipProxy, BSTR bstrMediaProxy, VARIANT_BOOL vbForceUpnpDisabled,
                         VARIANT_BOOL vbForceStunDisabled) override;
    HRESULT get_StunServer(BSTR* pVal) override;
    HRESULT get_StartingPort(LONG* pVal) override;
    HRESULT get_NumberOfPorts(LONG* pVal) override;
    HRESULT get_State(PM_STATE* pVal) override;
    HRESULT get_Topology(PM_TOPOLOGY* pVal) override;
    HRESULT InitiateShutdown() override;
    HRESULT get_RecommendedPortManager(IUnknown** pVal) override;
    HRESULT get_RecommendedSipServer(BSTR* pVal) override;
    HRESULT get_RecommendedUpnpEnabled(VARIANT_BOOL* pVal) override;
    HRESULT OnBeforeEnableProfile(VARIANT networkAddresses, LONG minSipPort, LONG maxSipPort,
                                  LONG minAudioRTPPort, LONG maxAudioRTPPort, LONG minAudioRTCPPort,
                                  LONG maxAudioRTCPPort, LONG minVideoRTPPort, LONG maxVideoRTPPort,
                                  LONG minVideoRTCPPort, LONG maxVideoRTCPPort,
                                  LONG portsPerProtocol) override;
    HRESULT OnBeforeDisableProfile() override;
    HRESULT InitializeEx2(BSTR bstrStunServerName, LONG lStartingPort, LONG lNumberOfPorts,
                          BSTR bstrSipProxy, BSTR bstrMediaProxy, VARIANT_BOOL vbForceUpnpDisabled,
                          VARIANT_BOOL vbForceStunDisabled, LONG lRefreshInterval,
                          VARIANT_BOOL vbRefreshAudio, VARIANT_BOOL vbRefreshVideo,
                          VARIANT_BOOL vbRefreshSIP) override;
    HRESULT get_ClientNameSuffix(BSTR* pVal) override;
    HRESULT get_PrivateIpAddress(BSTR* pVal) override;
    HRESULT get_PublicIpAddress(BSTR* pVal) override;
    HRESULT Refresh() override;
    HRESULT OnBeforeEnableProfileEx(VARIANT networkAddresses, LONG minPort, LONG maxPort,
                                    LONG portsPerProtocol, VARIANT_BOOL randomizePorts) override;
    HRESULT DiagnoseNetwork(BSTR bstrWellKnownNetworkAddress, BSTR bstrStunServer,
                            BSTR bstrEchoServer, INT nEchoServerPort, LONG timeout,
                            LONG cookie) override;
    HRESULT get_UDPPacketsIn(LONG* pVal) override;
    HRESULT ErrorCanBeDiagnosed(LONG errorCode, VARIANT_BOOL* pVal) override;

    // IPortMappingProvider
    HRESULT GetMapping(BSTR address, LONG type, BSTR* privateAddress, LONG* privatePort,
                       BSTR* publicAddress, LONG* publicPort) override;
    HRESULT UpdateRemoteAddress(LONG a, LONG b, LONG c, LONG d, LONG e) override;
    HRESULT ReleaseMapping(BSTR privateAddress, LONG privatePort, BSTR publicAddress,
                           LONG publicPort) override;
    HRESULT UpdateRemoteAddressEx(BSTR remoteAddress, LONG remotePort, BSTR privateAddress,
                                  LONG privatePort, BSTR publicAddress, LONG publicPort) override;

    // INqDiagnostics
    HRESULT get_LogLevel(INT* pLevel) override;
    HRESULT put_LogLevel(INT level) override;
    HRESULT get_LogFolder(BSTR* pbstrFolder) override;
    HRESULT get_LogFilePrefix(BSTR* pbstrPrefix) override;
    HRESULT get_LogFileExtension(BSTR* pbstrExtension) override;
    HRESULT get_LoggingEnabled(VARIANT_BOOL* pbEnabled) override;
    HRESULT put_LoggingEnabled(VARIANT_BOOL enabled) override;
    HRESULT InitializeLogging(BSTR bstrFolder, BSTR bstrPrefix, BSTR bstrExt, INT LogLevel,
                              VARIANT_BOOL enabled) override;
    HRESULT ShutdownLogging() override;

    // INetworkChangeSink (the monitor's thread)
    void OnLocalIPsChanged() override;
    void OnRouteChanged() override;

    // The hidden window
    platform::LRESULT WindowProc(platform::UINT message, platform::WPARAM wParam,
                                 platform::LPARAM lParam, bool& handled) override;

  private:
    // The object's own reference count and interface table. It is the controlling unknown unless
    // an outer object aggregates the port manager.
    struct InnerUnknown final : IUnknown {
        explicit InnerUnknown(CAdvancedPortManager& owner) : owner(owner) {}
        HRESULT QueryInterface(REFIID riid, void** ppv) override;
        ULONG AddRef() override;
        ULONG Release() override;
        CAdvancedPortManager& owner;
    };

    CAdvancedPortManager(PortManagerServices services, IUnknown* outer);
    ~CAdvancedPortManager() override;

    HRESULT FinalConstruct();
    void FinalRelease();
    void ResetToDefaults();
    void ResetRecommendations();

    // Window messages
    void OnTimer(uintptr_t timerId);
    void OnUpnpDetected();
    void OnStunRefresh();
    void NotifyChange(PM_EVENT type);
    void OnDiagnosticComplete(platform::WPARAM wParam);
    // Discovery
    void StartStunDiscovery();
    // What the answer concludes, applied and told to the sinks (or the STUN pass started).
    void Conclude(DiscoveryInput::Answer answer);
    DiscoveryInput Facts(DiscoveryInput::Answer answer,
                         const stun::STUNResultList* stunResults) const;
    void Apply(DiscoveryOutcome outcome);

    std::atomic<ULONG> m_refs{0};
    InnerUnknown m_inner{*this};
    IUnknown* m_controlling;  // the outer object, or m_inner
    platform::ModuleReference m_moduleLock;
    PortManagerServices m_services;
    ConnectionPoint<_IAdvancedPortManagerEvents> m_events{DIID__IAdvancedPortManagerEvents};
    // A copy of the window handle for the monitor's thread, cleared before the window goes.
    std::atomic<platform::WindowHandle> m_workerWindow{nullptr};

    std::unique_ptr<stun::ISTUNResult> m_pStunResult;
    UpnpDetector m_upnpDetector;
    std::optional<std::string> m_stunServer;
    LONG m_startingPort = 5004;
    LONG m_numberOfPorts = 16;
    PM_STATE m_state = PMS_UNINITIALIZED;
    PM_TOPOLOGY m_topology = PMT_UNKNOWN;
    std::string m_sipProxy;
    std::string m_mediaProxy;
    std::string m_recommendedSipServer;
    std::optional<std::string> m_privateIpAddress;
    std::optional<std::string> m_publicIpAddress;
    bool m_forceUpnpDisabled = false;
    bool m_forceStunDisabled = false;
    bool m_stunAddressesInUse = false;
    bool m_recommendedUpnpEnabled = false;
    bool m_discoveryComplete = false;
    LONG m_refreshInterval = 30000;
    bool m_refreshAudio = true;
    bool m_refreshVideo = true;
    bool m_refreshSIP = true;
    uintptr_t m_refreshTimerId = 0;

    ProfileMappings m_profile;

    foundation::CNetworkChangeMonitor m_monitor;
    // Stopped and joined by Shutdown and the final release, before the window goes.
    diagnostics::DiagnosticRuns m_diagnosticRuns;
};

}  // namespace portmanager
