// NqPortManager: NAT traversal for SIP voice and video clients.
//
// The interfaces are those of the COM in-process server: abstract classes whose vtables follow
// COM's order (QueryInterface, AddRef, Release, then the members in order), so client code reads
// the same on every platform. Strings are BSTRs, booleans VARIANT_BOOL, results HRESULTs.
//
// Threads: create the objects on one thread and call them only from it. That thread must pump its
// message queue (NqRunMessageLoop, or NqPumpPendingMessages whenever NqMessageQueueDescriptor()
// is readable; see messageloop.h): discovery outcomes, keep-alive timers and events all arrive
// through it, and events are fired on it.
#pragma once

#include <nqportmanager/ComPtr.h>
#include <nqportmanager/com.h>
#include <nqportmanager/messageloop.h>
#include <nqportmanager/typeinfo.h>

enum PM_STATE : int32_t {
    PMS_UNINITIALIZED = 0,
    PMS_INITIALIZING = 1,
    PMS_COMPLETED = 2,
};

enum PM_TOPOLOGY : int32_t {
    PMT_UNKNOWN = 0,
    PMT_STUN_OPEN = 1,
    PMT_STUN_FULL_CONE_FIREWALL = 2,
    PMT_STUN_FULL_CONE_NAT = 3,
    PMT_STUN_RESTRICTED_CONE_NAT = 4,
    PMT_STUN_PORT_RESTRICTED_CONE_NAT = 5,
    PMT_STUN_SYMMETRIC_FIREWALL = 6,
    PMT_STUN_SYMMETRIC_NAT = 7,
    PMT_STUN_BLOCKED = 8,
    PMT_UPNP_ENABLED_NAT_OR_FIREWALL = 9,
};

enum PM_EVENT : int32_t {
    PME_UPDATED = 0,
    PME_SHUTDOWN = 1,
    PME_NETWORK_CHANGE = 2,
    PME_DIAGNOSTIC_COMPLETED = 3,
};

// Result codes of a diagnostic run. The numbers are what a run reports; for 2 to 10 the names
// do not tell the condition (4: no route to the Internet, 3: no gateway, 7 and 8: name
// resolution, 9 and 10: the UDP port 3478 test). ErrorText of the event gives the meaning.
enum PM_DIAGNOSTIC_RESULT : int32_t {
    PMDR_NO_ERROR = 0,
    PMDR_TEST_NOT_RUN = 1,
    PMDR_NO_INTERFACE_WITH_GATEWAY = 2,
    PMDR_NO_INTERFACE_WITH_ROUTE = 3,
    PMDR_TIMEOUT = 4,
    PMDR_CANT_ICMP = 5,
    PMDR_CANT_RESOLVE_NOQUA_UDP_SERVER = 6,
    PMDR_CANT_RESOLVE_ROOT_DNS_SERVER = 7,
    PMDR_CANT_CONVERT_LOCAL_IP_ADDRESS = 8,
    PMDR_CANT_CONTACT_STUN_SERVER_ON_UDP_PORT_3478 = 9,
    PMDR_CANT_RESOLVE_NOQUA_TCP_SERVER = 10,
    PMDR_CANT_CREATE_TCP_SOCKET = 11,
    PMDR_CANT_LOAD_ICMP_LIBRARY = 12,
    PMDR_CANT_FIND_SENDECHO2_PROCADDR = 13,
    PMDR_CANT_CONNECT_TO_ECHO_SERVER = 14,
    PMDR_ECHO_SERVER_LOGIN_SEND_FAILED = 15,
    PMDR_ECHO_SERVER_LOGIN_RECV_FAILED = 16,
    PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_STATUS = 17,
    PMDR_ECHO_SERVER_LOGIN_RESPONSE_FAILED_STATUS = 18,
    PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_SESSIONID = 19,
    PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_SIPPORT = 20,
    PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_AUDIORTP = 21,
    PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_AUDIORTCP = 22,
    PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_VIDEORTP = 23,
    PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_VIDEORTCP = 24,
    PMDR_ECHO_SERVER_CANT_ALLOCATE_SIP_SOCKET = 25,
    PMDR_ECHO_SERVER_CANT_ALLOCATE_MEDIA_SOCKET = 26,
    PMDR_ECHO_SERVER_SIP_UDP_SEND_FAILED = 27,
    PMDR_ECHO_SERVER_SIP_UDP_RECV_FAILED = 28,
    PMDR_ECHO_SERVER_SIP_TCP_SEND_FAILED = 29,
    PMDR_ECHO_SERVER_SIP_TCP_RECV_FAILED = 30,
    PMDR_ECHO_SERVER_SIP_NO_UDP_OR_TCP = 31,
    PMDR_ECHO_SERVER_SIP_NO_UDP = 32,
    PMDR_ECHO_SERVER_SIP_NO_TCP = 33,
    PMDR_ECHO_SERVER_SIP_MALFORMED_TCP_PACKET = 34,
    PMDR_ECHO_SERVER_SIP_UDP_DIFFERENT_LENGTH = 35,
    PMDR_ECHO_SERVER_SIP_UDP_DATA_DIFFERENT = 36,
    PMDR_ECHO_SERVER_SIP_TCP_PACKETS_DIFFERENT = 37,
    PMDR_ECHO_SERVER_SIP_TCP_PACKETS_DIFFERENT_SIZE = 38,
    PMDR_ECHO_SERVER_LOGIN_RECV_FAILED_TIMEOUT = 39,
    PMDR_ECHO_SERVER_TCP_SET_ASYNC_FAILED = 40,
    PMDR_ECHO_SERVER_UDP_SET_ASYNC_FAILED = 41,
    PMDR_ECHO_SERVER_CANT_RESOLVE_NAME = 42,
    PMDR_ECHO_SERVER_LAST_ERROR = 43,
};

// The tests of a diagnostic run.
enum PM_DIAGNOSTIC_TEST_TYPE : int32_t {
    PMNTT_TEST_LOCATE_INTERFACE = 0,
    PMNTT_TEST_PING_GATEWAY = 1,  // not run: its entry stays PMDR_TEST_NOT_RUN
    PMNTT_TEST_DNS = 2,
    PMNTT_TEST_STUN = 3,
    PMNTT_TEST_ECHO = 4,
    PMNTT_TEST_ECHO_SIP = 5,
    PMNTT_TEST_ECHO_SIP_INVITE_REQUEST = 6,
    PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE = 7,
    PMNTT_TEST_ECHO_SIP_REGISTER_REQUEST = 8,
    PMNTT_TEST_ECHO_SIP_REGISTER_RESPONSE = 9,
    PMNTT_TEST_ECHO_MEDIA = 10,
    PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET = 11,
};

// The type argument of IPortMappingProvider::GetMapping.
enum PortMappingType : int32_t {
    AudioRTP = 0,
    AudioRTCP = 1,
    VideoRTP = 2,
    VideoRTCP = 3,
    SIP = 4,
};

inline constexpr GUID LIBID_NqPortManagerLib = MakeGuid("AB2DF447-AB6E-4B85-A711-1B18EB6F9373");
inline constexpr CLSID CLSID_AdvancedPortManager = MakeGuid("28156084-AE26-4971-83A0-74567B29AD24");
inline constexpr CLSID CLSID_LocalSipProxy = MakeGuid("85E7C75C-49D7-4971-8751-90CC1666D14E");
inline constexpr CLSID CLSID_PortManagerUpdateEvent =
    MakeGuid("120F301B-3AF2-41FE-B21A-FADD511464B9");
inline constexpr CLSID CLSID_NetworkDiagnosticEvent =
    MakeGuid("790E48F3-CBA4-4EB2-AAD8-E19C06C39FD7");
inline constexpr IID IID_IAdvancedPortManager = MakeGuid("67BB31D3-5F3B-469E-B719-AE5223EDC5D5");
inline constexpr IID IID_INqDiagnostics = MakeGuid("0991CB11-334B-4B2C-B19E-A5DC2F7645DB");
inline constexpr IID DIID__IAdvancedPortManagerEvents =
    MakeGuid("0AFB8C5E-1C4A-4BB9-BF51-7A872822DBDE");
inline constexpr IID IID_IPortManagerUpdateEvent = MakeGuid("EE9A8A46-776D-4C9F-B7B1-E201B044A9CC");
inline constexpr IID IID_INetworkDiagnosticEvent = MakeGuid("827A1D3A-73BE-45EE-AC32-A5C5707C4D87");
inline constexpr IID IID_INetworkDiagnosticTests = MakeGuid("72FE03CD-4526-447C-B47A-B84CD778AA06");
inline constexpr IID IID_ILocalSipProxy = MakeGuid("B9CF6437-54BC-41D7-9F91-4E4CD48CC0DF");
inline constexpr IID IID_ILocalSipProxyStatus = MakeGuid("5504DEDF-56F2-413D-9D95-C5EB239DAA83");
// The port-mapping interface answers under two ids that share one implementation.
inline constexpr IID IID_IPortMappingProvider = MakeGuid("24C284AB-8AEC-462A-B740-0756B3A33D5B");
inline constexpr IID IID_IPortMappingProvider2 = MakeGuid("23D7AA83-0D64-4643-BAC1-5894837451ED");
inline constexpr GUID APPID_NqPortManager = MakeGuid("EF9E4928-571F-4C6A-86C4-1D4EA4814393");

struct IAdvancedPortManager : public IDispatch {
    virtual HRESULT Shutdown() = 0;
    virtual HRESULT InitializeEx(BSTR bstrStunServerName, LONG lStartingPort, LONG lNumberOfPorts,
                                 BSTR bstrSipProxy, BSTR bstrMediaProxy,
                                 VARIANT_BOOL vbForceUpnpDisabled,
                                 VARIANT_BOOL vbForceStunDisabled) = 0;
    virtual HRESULT get_StunServer(BSTR* pVal) = 0;
    virtual HRESULT get_StartingPort(LONG* pVal) = 0;
    virtual HRESULT get_NumberOfPorts(LONG* pVal) = 0;
    virtual HRESULT get_State(PM_STATE* pVal) = 0;
    virtual HRESULT get_Topology(PM_TOPOLOGY* pVal) = 0;
    virtual HRESULT InitiateShutdown() = 0;
    virtual HRESULT get_RecommendedPortManager(IUnknown** pVal) = 0;
    virtual HRESULT get_RecommendedSipServer(BSTR* pVal) = 0;
    virtual HRESULT get_RecommendedUpnpEnabled(VARIANT_BOOL* pVal) = 0;
    virtual HRESULT OnBeforeEnableProfile(VARIANT networkAddresses, LONG minSipPort,
                                          LONG maxSipPort, LONG minAudioRTPPort,
                                          LONG maxAudioRTPPort, LONG minAudioRTCPPort,
                                          LONG maxAudioRTCPPort, LONG minVideoRTPPort,
                                          LONG maxVideoRTPPort, LONG minVideoRTCPPort,
                                          LONG maxVideoRTCPPort, LONG portsPerProtocol) = 0;
    virtual HRESULT OnBeforeDisableProfile() = 0;
    virtual HRESULT InitializeEx2(BSTR bstrStunServerName, LONG lStartingPort, LONG lNumberOfPorts,
                                  BSTR bstrSipProxy, BSTR bstrMediaProxy,
                                  VARIANT_BOOL vbForceUpnpDisabled,
                                  VARIANT_BOOL vbForceStunDisabled, LONG lRefreshInterval,
                                  VARIANT_BOOL vbRefreshAudio, VARIANT_BOOL vbRefreshVideo,
                                  VARIANT_BOOL vbRefreshSIP) = 0;
    virtual HRESULT get_ClientNameSuffix(BSTR* pVal) = 0;
    virtual HRESULT get_PrivateIpAddress(BSTR* pVal) = 0;
    virtual HRESULT get_PublicIpAddress(BSTR* pVal) = 0;
    virtual HRESULT Refresh() = 0;
    // networkAddresses: a VARIANT of type VT_ARRAY | VT_BSTR, one "address[:port]" per element.
    virtual HRESULT OnBeforeEnableProfileEx(VARIANT networkAddresses, LONG minPort, LONG maxPort,
                                            LONG portsPerProtocol, VARIANT_BOOL randomizePorts) = 0;
    // Starts a diagnostic run on a thread of its own and returns at once; its outcome arrives as
    // PME_DIAGNOSTIC_COMPLETED with an INetworkDiagnosticEvent carrying the cookie. The run
    // locates the interface toward the well-known address (a dotted quad), checks its gateway,
    // resolves the STUN server, asks it on UDP port 3478, then logs in to the echo server
    // (host[:port given apart]) and checks SIP and media echoes; timeout (ms) bounds every wait.
    // E_POINTER for a null string, E_INVALIDARG for a port outside 1..65534 or a negative
    // timeout. Several runs may go on at once; Shutdown and the final release stop and wait for
    // them (a stopped run fires nothing).
    // The media echo sends 1398 bytes starting with "Call-ID: <session id>\r\n"; a session id
    // too long for that line is cut so that the payload stays 1398 bytes.
    virtual HRESULT DiagnoseNetwork(BSTR bstrWellKnownNetworkAddress, BSTR bstrStunServer,
                                    BSTR bstrEchoServer, INT nEchoServerPort, LONG timeout,
                                    LONG cookie) = 0;
    virtual HRESULT get_UDPPacketsIn(LONG* pVal) = 0;
    virtual HRESULT ErrorCanBeDiagnosed(LONG errorCode, VARIANT_BOOL* pVal) = 0;
};

// The logger that every object of the process shares.
struct INqDiagnostics : public IUnknown {
    virtual HRESULT get_LogLevel(INT* pLevel) = 0;
    virtual HRESULT put_LogLevel(INT level) = 0;
    virtual HRESULT get_LogFolder(BSTR* pbstrFolder) = 0;
    virtual HRESULT get_LogFilePrefix(BSTR* pbstrPrefix) = 0;
    virtual HRESULT get_LogFileExtension(BSTR* pbstrExtension) = 0;
    virtual HRESULT get_LoggingEnabled(VARIANT_BOOL* pbEnabled) = 0;
    virtual HRESULT put_LoggingEnabled(VARIANT_BOOL enabled) = 0;
    virtual HRESULT InitializeLogging(BSTR bstrFolder, BSTR bstrPrefix, BSTR bstrExt, INT LogLevel,
                                      VARIANT_BOOL enabled) = 0;
    virtual HRESULT ShutdownLogging() = 0;
};

// The client's sink: connect it to the port manager's connection point for
// DIID__IAdvancedPortManagerEvents. Event is called synchronously on the client's thread.
struct _IAdvancedPortManagerEvents : public IUnknown {
    virtual HRESULT Event(PM_EVENT EventType, IDispatch* pEvent) = 0;
};

// Travels with PME_UPDATED and PME_NETWORK_CHANGE; names the port manager that fired it.
struct IPortManagerUpdateEvent : public IDispatch {
    virtual HRESULT get_PortManager(IAdvancedPortManager** pVal) = 0;
    virtual HRESULT put_PortManager(IAdvancedPortManager* newVal) = 0;
};

// Travels with PME_DIAGNOSTIC_COMPLETED: the test recorded last (the failing one, or the last
// test of a clean run) and the cookie given to DiagnoseNetwork. Every getter gives E_POINTER
// for a null out argument; returned BSTRs belong to the caller.
struct INetworkDiagnosticEvent : public IDispatch {
    virtual HRESULT get_errorCode(PM_DIAGNOSTIC_RESULT* pVal) = 0;
    virtual HRESULT get_ErrorText(BSTR* pVal) = 0;
    virtual HRESULT get_TestType(PM_DIAGNOSTIC_TEST_TYPE* pVal) = 0;
    virtual HRESULT get_TestTypeText(BSTR* pVal) = 0;
    virtual HRESULT get_AdditionalInfo(BSTR* pVal) = 0;
    virtual HRESULT get_cookie(LONG* pVal) = 0;
};

// Every test of a diagnostic run, not only the last: query it from the INetworkDiagnosticEvent
// (this platform's addition; the interface above stays as clients know it).
struct INetworkDiagnosticTests : public IUnknown {
    virtual HRESULT get_TestCount(LONG* pVal) = 0;
    // Tests in the order of their type, with the texts the event gives for its last test;
    // E_INVALIDARG for an index outside 0..count-1.
    virtual HRESULT GetTest(LONG index, PM_DIAGNOSTIC_TEST_TYPE* type, BSTR* typeText,
                            PM_DIAGNOSTIC_RESULT* errorCode, BSTR* errorText,
                            BSTR* additionalInfo) = 0;
};

// Port mappings of the port manager (query it from IAdvancedPortManager).
struct IPortMappingProvider : public IUnknown {
    // type: a PortMappingType. Returned BSTRs belong to the caller.
    virtual HRESULT GetMapping(BSTR address, LONG type, BSTR* privateAddress, LONG* privatePort,
                               BSTR* publicAddress, LONG* publicPort) = 0;
    virtual HRESULT UpdateRemoteAddress(LONG a, LONG b, LONG c, LONG d, LONG e) = 0;
    virtual HRESULT ReleaseMapping(BSTR privateAddress, LONG privatePort, BSTR publicAddress,
                                   LONG publicPort) = 0;
    // Registers the remote endpoint of a media mapping: its keep-alives go there until
    // ReleaseMapping. On Linux the keep-alive is sent from the mapping's own private port, which
    // works while your media socket is bound there only if that socket set SO_REUSEADDR before
    // binding (Linux lets two sockets share a UDP port only when both allow it).
    virtual HRESULT UpdateRemoteAddressEx(BSTR remoteAddress, LONG remotePort, BSTR privateAddress,
                                          LONG privatePort, BSTR publicAddress,
                                          LONG publicPort) = 0;
};

// The local SIP proxy: the client's outbound proxy on this machine. Set InternalAddress (the
// local address the client uses), send SIP to SenderEndpoint, and Start it with the port manager
// whose profile is enabled: datagrams then go, rewritten, to the recommended SIP server and back.
// Stop (or the final Release) ends the relay; no datagram from the network can end it.
struct ILocalSipProxy : public IDispatch {
    virtual HRESULT get_InternalAddress(BSTR* pVal) = 0;
    virtual HRESULT put_InternalAddress(BSTR newVal) = 0;
    virtual HRESULT get_SenderEndpoint(BSTR* pVal) = 0;
    virtual HRESULT Start(IAdvancedPortManager* pPortManager, LONG minPort, LONG maxPort,
                          VARIANT_BOOL vbRandomize) = 0;
    virtual HRESULT Stop() = 0;
};

// Not part of the Windows component: what a running proxy does, for tools and monitoring. The
// proxy answers it beside ILocalSipProxy.
struct ILocalSipProxyStatus : public IUnknown {
    // The datagrams relayed each way and those dropped since Start.
    virtual HRESULT GetRelayCounts(uint64_t* toServer, uint64_t* toClient, uint64_t* dropped) = 0;
    // After a successful Start: the contact the server is to use for the client, and the server.
    virtual HRESULT get_PublicContact(BSTR* pVal) = 0;
    virtual HRESULT get_ServerEndpoint(BSTR* pVal) = 0;

  protected:
    ~ILocalSipProxyStatus() = default;
};

NQ_DECLARE_COM_IID(IAdvancedPortManager, IID_IAdvancedPortManager);
NQ_DECLARE_COM_IID(ILocalSipProxy, IID_ILocalSipProxy);
NQ_DECLARE_COM_IID(ILocalSipProxyStatus, IID_ILocalSipProxyStatus);
NQ_DECLARE_COM_IID(INqDiagnostics, IID_INqDiagnostics);
NQ_DECLARE_COM_IID(_IAdvancedPortManagerEvents, DIID__IAdvancedPortManagerEvents);
NQ_DECLARE_COM_IID(IPortManagerUpdateEvent, IID_IPortManagerUpdateEvent);
NQ_DECLARE_COM_IID(IPortMappingProvider, IID_IPortMappingProvider);
NQ_DECLARE_COM_IID(INetworkDiagnosticEvent, IID_INetworkDiagnosticEvent);
NQ_DECLARE_COM_IID(INetworkDiagnosticTests, IID_INetworkDiagnosticTests);

// The module's entry points, as a COM in-process server exports them (libNqPortManager.so).
extern "C" {
NQ_MODULE_EXPORT HRESULT DllGetClassObject(REFCLSID rclsid, REFIID riid, void** ppv);
NQ_MODULE_EXPORT HRESULT DllCanUnloadNow();
NQ_MODULE_EXPORT HRESULT DllRegisterServer();
NQ_MODULE_EXPORT HRESULT DllUnregisterServer();
}
