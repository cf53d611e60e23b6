#include "automation/NqPortManagerLib.h"

namespace automation {

template <>
inline constexpr const char* kUserTypeName<PM_STATE> = "PM_STATE";
template <>
inline constexpr const char* kUserTypeName<PM_TOPOLOGY> = "PM_TOPOLOGY";
template <>
inline constexpr const char* kUserTypeName<PM_EVENT> = "PM_EVENT";
template <>
inline constexpr const char* kUserTypeName<PM_DIAGNOSTIC_RESULT> = "PM_DIAGNOSTIC_RESULT";
template <>
inline constexpr const char* kUserTypeName<PM_DIAGNOSTIC_TEST_TYPE> = "PM_DIAGNOSTIC_TEST_TYPE";
template <>
inline constexpr const char* kUserTypeName<IAdvancedPortManager> = "IAdvancedPortManager";

namespace {

constexpr TypeRef kBstr{VT_BSTR};
constexpr TypeRef kLong{VT_I4};
constexpr TypeRef kInt{VT_INT};
constexpr TypeRef kBool{VT_BOOL};
constexpr TypeRef kVariant{VT_VARIANT};
constexpr TypeRef kBstrOut{VT_BSTR, nullptr, true};
constexpr TypeRef kLongOut{VT_I4, nullptr, true};
constexpr TypeRef kIntOut{VT_INT, nullptr, true};
constexpr TypeRef kBoolOut{VT_BOOL, nullptr, true};
constexpr TypeRef kPortManager{VT_USERDEFINED, "IAdvancedPortManager"};
constexpr TypeRef kPortManagerOut{VT_USERDEFINED, "IAdvancedPortManager", true};

constexpr TypeRef Out(const char* userType) {
    return {VT_USERDEFINED, userType, true};
}

constexpr INVOKEKIND kFunc = INVOKE_FUNC;
constexpr INVOKEKIND kGet = INVOKE_PROPERTYGET;
constexpr INVOKEKIND kPut = INVOKE_PROPERTYPUT;

// ---- IAdvancedPortManager ---------------------------------------------------------------------

using PM = IAdvancedPortManager;

constexpr ParamDesc kInitializeEx[] = {
    {"bstrStunServerName", kBstr}, {"lStartingPort", kLong},  {"lNumberOfPorts", kLong},
    {"bstrSipProxy", kBstr},       {"bstrMediaProxy", kBstr}, {"vbForceUpnpDisabled", kBool},
    {"vbForceStunDisabled", kBool}};
constexpr ParamDesc kInitializeEx2[] = {
    {"bstrStunServerName", kBstr},  {"lStartingPort", kLong},    {"lNumberOfPorts", kLong},
    {"bstrSipProxy", kBstr},        {"bstrMediaProxy", kBstr},   {"vbForceUpnpDisabled", kBool},
    {"vbForceStunDisabled", kBool}, {"lRefreshInterval", kLong}, {"vbRefreshAudio", kBool},
    {"vbRefreshVideo", kBool},      {"vbRefreshSIP", kBool}};
constexpr ParamDesc kOnBeforeEnableProfile[] = {
    {"networkAddresses", kVariant}, {"minSipPort", kLong},       {"maxSipPort", kLong},
    {"minAudioRTPPort", kLong},     {"maxAudioRTPPort", kLong},  {"minAudioRTCPPort", kLong},
    {"maxAudioRTCPPort", kLong},    {"minVideoRTPPort", kLong},  {"maxVideoRTPPort", kLong},
    {"minVideoRTCPPort", kLong},    {"maxVideoRTCPPort", kLong}, {"portsPerProtocol", kLong}};
constexpr ParamDesc kOnBeforeEnableProfileEx[] = {{"networkAddresses", kVariant},
                                                  {"minPort", kLong},
                                                  {"maxPort", kLong},
                                                  {"portsPerProtocol", kLong},
                                                  {"randomizePorts", kBool}};
constexpr ParamDesc kDiagnoseNetwork[] = {{"bstrWellKnownNetworkAddress", kBstr},
                                          {"bstrStunServer", kBstr},
                                          {"bstrEchoServer", kBstr},
                                          {"nEchoServerPort", kInt},
                                          {"timeout", kLong},
                                          {"cookie", kLong}};
constexpr ParamDesc kErrorCanBeDiagnosed[] = {{"errorCode", kLong}, {"pVal", kBoolOut}};
constexpr ParamDesc kBstrVal[] = {{"pVal", kBstrOut}};
constexpr ParamDesc kLongVal[] = {{"pVal", kLongOut}};
constexpr ParamDesc kBoolVal[] = {{"pVal", kBoolOut}};
constexpr ParamDesc kStateVal[] = {{"pVal", Out("PM_STATE")}};
constexpr ParamDesc kTopologyVal[] = {{"pVal", Out("PM_TOPOLOGY")}};
constexpr ParamDesc kUnknownVal[] = {{"pVal", {VT_UNKNOWN, nullptr, true}}};

constexpr MemberDesc kPortManagerMembers[] = {
    MakeMember<&PM::Shutdown>("Shutdown", 2, kFunc),
    MakeMember<&PM::InitializeEx>("InitializeEx", 3, kFunc, kInitializeEx),
    MakeMember<&PM::get_StunServer>("StunServer", 4, kGet, kBstrVal),
    MakeMember<&PM::get_StartingPort>("StartingPort", 5, kGet, kLongVal),
    MakeMember<&PM::get_NumberOfPorts>("NumberOfPorts", 6, kGet, kLongVal),
    MakeMember<&PM::get_State>("State", 7, kGet, kStateVal),
    MakeMember<&PM::get_Topology>("Topology", 8, kGet, kTopologyVal),
    MakeMember<&PM::InitiateShutdown>("InitiateShutdown", 9, kFunc),
    MakeMember<&PM::get_RecommendedPortManager>("RecommendedPortManager", 10, kGet, kUnknownVal),
    MakeMember<&PM::get_RecommendedSipServer>("RecommendedSipServer", 11, kGet, kBstrVal),
    MakeMember<&PM::get_RecommendedUpnpEnabled>("RecommendedUpnpEnabled", 12, kGet, kBoolVal),
    MakeMember<&PM::OnBeforeEnableProfile>("OnBeforeEnableProfile", 13, kFunc,
                                           kOnBeforeEnableProfile),
    MakeMember<&PM::OnBeforeDisableProfile>("OnBeforeDisableProfile", 14, kFunc),
    MakeMember<&PM::InitializeEx2>("InitializeEx2", 15, kFunc, kInitializeEx2),
    MakeMember<&PM::get_ClientNameSuffix>("ClientNameSuffix", 16, kGet, kBstrVal),
    MakeMember<&PM::get_PrivateIpAddress>("PrivateIpAddress", 17, kGet, kBstrVal),
    MakeMember<&PM::get_PublicIpAddress>("PublicIpAddress", 18, kGet, kBstrVal),
    MakeMember<&PM::Refresh>("Refresh", 19, kFunc),
    MakeMember<&PM::OnBeforeEnableProfileEx>("OnBeforeEnableProfileEx", 20, kFunc,
                                             kOnBeforeEnableProfileEx),
    MakeMember<&PM::DiagnoseNetwork>("DiagnoseNetwork", 21, kFunc, kDiagnoseNetwork),
    MakeMember<&PM::get_UDPPacketsIn>("UDPPacketsIn", 22, kGet, kLongVal),
    MakeMember<&PM::ErrorCanBeDiagnosed>("ErrorCanBeDiagnosed", 23, kFunc, kErrorCanBeDiagnosed),
};

// ---- INqDiagnostics (IUnknown-based: its ids only name the members) ---------------------------

using Diag = INqDiagnostics;

constexpr ParamDesc kLevelOut[] = {{"pLevel", kIntOut}};
constexpr ParamDesc kLevelIn[] = {{"level", kInt}};
constexpr ParamDesc kFolderOut[] = {{"pbstrFolder", kBstrOut}};
constexpr ParamDesc kPrefixOut[] = {{"pbstrPrefix", kBstrOut}};
constexpr ParamDesc kExtensionOut[] = {{"pbstrExtension", kBstrOut}};
constexpr ParamDesc kEnabledOut[] = {{"pbEnabled", kBoolOut}};
constexpr ParamDesc kEnabledIn[] = {{"enabled", kBool}};
constexpr ParamDesc kInitializeLogging[] = {{"bstrFolder", kBstr},
                                            {"bstrPrefix", kBstr},
                                            {"bstrExt", kBstr},
                                            {"LogLevel", kInt},
                                            {"enabled", kBool}};

constexpr MemberDesc kDiagnosticsMembers[] = {
    MakeMember<&Diag::get_LogLevel>("LogLevel", 1, kGet, kLevelOut),
    MakeMember<&Diag::put_LogLevel>("LogLevel", 1, kPut, kLevelIn),
    MakeMember<&Diag::get_LogFolder>("LogFolder", 2, kGet, kFolderOut),
    MakeMember<&Diag::get_LogFilePrefix>("LogFilePrefix", 3, kGet, kPrefixOut),
    MakeMember<&Diag::get_LogFileExtension>("LogFileExtension", 4, kGet, kExtensionOut),
    MakeMember<&Diag::get_LoggingEnabled>("LoggingEnabled", 5, kGet, kEnabledOut),
    MakeMember<&Diag::put_LoggingEnabled>("LoggingEnabled", 5, kPut, kEnabledIn),
    MakeMember<&Diag::InitializeLogging>("InitializeLogging", 6, kFunc, kInitializeLogging),
    MakeMember<&Diag::ShutdownLogging>("ShutdownLogging", 7, kFunc),
};

// ---- _IAdvancedPortManagerEvents ----------------------------------------------------------------

constexpr ParamDesc kEvent[] = {{"EventType", {VT_USERDEFINED, "PM_EVENT"}},
                                {"pEvent", {VT_DISPATCH}}};
constexpr MemberDesc kEventsMembers[] = {
    MakeMember<&_IAdvancedPortManagerEvents::Event>("Event", 1, kFunc, kEvent),
};

// ---- IPortManagerUpdateEvent, INetworkDiagnosticEvent, ILocalSipProxy ---------------------------

constexpr ParamDesc kPortManagerGet[] = {{"pVal", kPortManagerOut}};
constexpr ParamDesc kPortManagerPut[] = {{"newVal", kPortManager}};
constexpr MemberDesc kUpdateEventMembers[] = {
    MakeMember<&IPortManagerUpdateEvent::get_PortManager>("PortManager", 1, kGet, kPortManagerGet),
    MakeMember<&IPortManagerUpdateEvent::put_PortManager>("PortManager", 1, kPut, kPortManagerPut),
};

using Diagnostic = INetworkDiagnosticEvent;
constexpr ParamDesc kResultVal[] = {{"pVal", Out("PM_DIAGNOSTIC_RESULT")}};
constexpr ParamDesc kTestTypeVal[] = {{"pVal", Out("PM_DIAGNOSTIC_TEST_TYPE")}};
constexpr MemberDesc kDiagnosticEventMembers[] = {
    MakeMember<&Diagnostic::get_errorCode>("errorCode", 1, kGet, kResultVal),
    MakeMember<&Diagnostic::get_ErrorText>("ErrorText", 2, kGet, kBstrVal),
    MakeMember<&Diagnostic::get_TestType>("TestType", 3, kGet, kTestTypeVal),
    MakeMember<&Diagnostic::get_TestTypeText>("TestTypeText", 4, kGet, kBstrVal),
    MakeMember<&Diagnostic::get_AdditionalInfo>("AdditionalInfo", 5, kGet, kBstrVal),
    MakeMember<&Diagnostic::get_cookie>("cookie", 6, kGet, kLongVal),
};

constexpr ParamDesc kAddressPut[] = {{"newVal", kBstr}};
constexpr ParamDesc kStart[] = {
    {"pPortManager", kPortManager}, {"minPort", kLong}, {"maxPort", kLong}, {"vbRandomize", kBool}};
constexpr MemberDesc kProxyMembers[] = {
    MakeMember<&ILocalSipProxy::get_InternalAddress>("InternalAddress", 1, kGet, kBstrVal),
    MakeMember<&ILocalSipProxy::put_InternalAddress>("InternalAddress", 1, kPut, kAddressPut),
    MakeMember<&ILocalSipProxy::get_SenderEndpoint>("SenderEndpoint", 2, kGet, kBstrVal),
    MakeMember<&ILocalSipProxy::Start>("Start", 3, kFunc, kStart),
    MakeMember<&ILocalSipProxy::Stop>("Stop", 4, kFunc),
};

// ---- Enumerations -------------------------------------------------------------------------------

#define NQ_VALUE(name) \
    EnumValue {        \
#name, name    \
    }

constexpr EnumValue kStates[] = {NQ_VALUE(PMS_UNINITIALIZED), NQ_VALUE(PMS_INITIALIZING),
                                 NQ_VALUE(PMS_COMPLETED)};
constexpr EnumValue kTopologies[] = {
    NQ_VALUE(PMT_UNKNOWN),
    NQ_VALUE(PMT_STUN_OPEN),
    NQ_VALUE(PMT_STUN_FULL_CONE_FIREWALL),
    NQ_VALUE(PMT_STUN_FULL_CONE_NAT),
    NQ_VALUE(PMT_STUN_RESTRICTED_CONE_NAT),
    NQ_VALUE(PMT_STUN_PORT_RESTRICTED_CONE_NAT),
    NQ_VALUE(PMT_STUN_SYMMETRIC_FIREWALL),
    NQ_VALUE(PMT_STUN_SYMMETRIC_NAT),
    NQ_VALUE(PMT_STUN_BLOCKED),
    NQ_VALUE(PMT_UPNP_ENABLED_NAT_OR_FIREWALL),
};
constexpr EnumValue kEvents[] = {NQ_VALUE(PME_UPDATED), NQ_VALUE(PME_SHUTDOWN),
                                 NQ_VALUE(PME_NETWORK_CHANGE), NQ_VALUE(PME_DIAGNOSTIC_COMPLETED)};
constexpr EnumValue kTestTypes[] = {
    NQ_VALUE(PMNTT_TEST_LOCATE_INTERFACE),
    NQ_VALUE(PMNTT_TEST_PING_GATEWAY),
    NQ_VALUE(PMNTT_TEST_DNS),
    NQ_VALUE(PMNTT_TEST_STUN),
    NQ_VALUE(PMNTT_TEST_ECHO),
    NQ_VALUE(PMNTT_TEST_ECHO_SIP),
    NQ_VALUE(PMNTT_TEST_ECHO_SIP_INVITE_REQUEST),
    NQ_VALUE(PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE),
    NQ_VALUE(PMNTT_TEST_ECHO_SIP_REGISTER_REQUEST),
    NQ_VALUE(PMNTT_TEST_ECHO_SIP_REGISTER_RESPONSE),
    NQ_VALUE(PMNTT_TEST_ECHO_MEDIA),
    NQ_VALUE(PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET),
};
constexpr EnumValue kResults[] = {
    NQ_VALUE(PMDR_NO_ERROR),
    NQ_VALUE(PMDR_TEST_NOT_RUN),
    NQ_VALUE(PMDR_NO_INTERFACE_WITH_GATEWAY),
    NQ_VALUE(PMDR_NO_INTERFACE_WITH_ROUTE),
    NQ_VALUE(PMDR_TIMEOUT),
    NQ_VALUE(PMDR_CANT_ICMP),
    NQ_VALUE(PMDR_CANT_RESOLVE_NOQUA_UDP_SERVER),
    NQ_VALUE(PMDR_CANT_RESOLVE_ROOT_DNS_SERVER),
    NQ_VALUE(PMDR_CANT_CONVERT_LOCAL_IP_ADDRESS),
    NQ_VALUE(PMDR_CANT_CONTACT_STUN_SERVER_ON_UDP_PORT_3478),
    NQ_VALUE(PMDR_CANT_RESOLVE_NOQUA_TCP_SERVER),
    NQ_VALUE(PMDR_CANT_CREATE_TCP_SOCKET),
    NQ_VALUE(PMDR_CANT_LOAD_ICMP_LIBRARY),
    NQ_VALUE(PMDR_CANT_FIND_SENDECHO2_PROCADDR),
    NQ_VALUE(PMDR_CANT_CONNECT_TO_ECHO_SERVER),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_SEND_FAILED),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RECV_FAILED),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_STATUS),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RESPONSE_FAILED_STATUS),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_SESSIONID),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_SIPPORT),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_AUDIORTP),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_AUDIORTCP),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_VIDEORTP),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RESPONSE_MISSING_VIDEORTCP),
    NQ_VALUE(PMDR_ECHO_SERVER_CANT_ALLOCATE_SIP_SOCKET),
    NQ_VALUE(PMDR_ECHO_SERVER_CANT_ALLOCATE_MEDIA_SOCKET),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_UDP_SEND_FAILED),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_UDP_RECV_FAILED),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_TCP_SEND_FAILED),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_TCP_RECV_FAILED),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_NO_UDP_OR_TCP),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_NO_UDP),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_NO_TCP),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_MALFORMED_TCP_PACKET),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_UDP_DIFFERENT_LENGTH),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_UDP_DATA_DIFFERENT),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_TCP_PACKETS_DIFFERENT),
    NQ_VALUE(PMDR_ECHO_SERVER_SIP_TCP_PACKETS_DIFFERENT_SIZE),
    NQ_VALUE(PMDR_ECHO_SERVER_LOGIN_RECV_FAILED_TIMEOUT),
    NQ_VALUE(PMDR_ECHO_SERVER_TCP_SET_ASYNC_FAILED),
    NQ_VALUE(PMDR_ECHO_SERVER_UDP_SET_ASYNC_FAILED),
    NQ_VALUE(PMDR_ECHO_SERVER_CANT_RESOLVE_NAME),
    NQ_VALUE(PMDR_ECHO_SERVER_LAST_ERROR),
};

#undef NQ_VALUE

// ---- Coclasses and the library ------------------------------------------------------------------

constexpr ImplType kPortManagerImpls[] = {
    {"IAdvancedPortManager", IMPLTYPEFLAG_FDEFAULT},
    {"INqDiagnostics", 0},
    {"_IAdvancedPortManagerEvents", IMPLTYPEFLAG_FDEFAULT | IMPLTYPEFLAG_FSOURCE},
};
constexpr ImplType kProxyImpls[] = {{"ILocalSipProxy", IMPLTYPEFLAG_FDEFAULT}};
constexpr ImplType kDiagnosticEventImpls[] = {{"INetworkDiagnosticEvent", IMPLTYPEFLAG_FDEFAULT}};

constexpr WORD kDual =
    TYPEFLAG_FDUAL | TYPEFLAG_FOLEAUTOMATION | TYPEFLAG_FNONEXTENSIBLE | TYPEFLAG_FDISPATCHABLE;
constexpr WORD kUnknownBased = 0;
constexpr WORD kDispatchSlots = 7;
constexpr WORD kUnknownSlots = 3;

constexpr TypeDesc Enumeration(const char* name, std::span<const EnumValue> values) {
    return {TKIND_ENUM, name, &GUID_NULL, 0, nullptr, {}, values, {}};
}

constexpr TypeDesc Interface(const char* name, const GUID& iid, WORD flags, const char* doc,
                             std::span<const MemberDesc> members) {
    return {TKIND_INTERFACE,
            name,
            &iid,
            flags,
            doc,
            members,
            {},
            {},
            flags == kDual ? kDispatchSlots : kUnknownSlots};
}

constexpr TypeDesc Coclass(const char* name, const GUID& clsid, const char* doc,
                           std::span<const ImplType> impls) {
    return {TKIND_COCLASS, name, &clsid, TYPEFLAG_FCANCREATE, doc, {}, {}, impls};
}

constexpr TypeDesc kTypes[] = {
    Enumeration("PM_STATE", kStates),
    Enumeration("PM_TOPOLOGY", kTopologies),
    Enumeration("PM_EVENT", kEvents),
    Enumeration("PM_DIAGNOSTIC_RESULT", kResults),
    Enumeration("PM_DIAGNOSTIC_TEST_TYPE", kTestTypes),
    Interface("IAdvancedPortManager", IID_IAdvancedPortManager, kDual,
              "IAdvancedPortManager Interface", kPortManagerMembers),
    Interface("INqDiagnostics", IID_INqDiagnostics, kUnknownBased, "INqDiagnostics Interface",
              kDiagnosticsMembers),
    Interface("_IAdvancedPortManagerEvents", DIID__IAdvancedPortManagerEvents, kUnknownBased,
              "_IAdvancedPortManagerEvents Interface", kEventsMembers),
    Interface("IPortManagerUpdateEvent", IID_IPortManagerUpdateEvent, kDual,
              "IPortManagerUpdateEvent Interface", kUpdateEventMembers),
    Interface("INetworkDiagnosticEvent", IID_INetworkDiagnosticEvent, kDual,
              "INetworkDiagnosticEvent Interface", kDiagnosticEventMembers),
    Interface("ILocalSipProxy", IID_ILocalSipProxy, kDual, "ILocalSipProxy Interface",
              kProxyMembers),
    Coclass("AdvancedPortManager", CLSID_AdvancedPortManager, "AdvancedPortManager Class",
            kPortManagerImpls),
    Coclass("LocalSipProxy", CLSID_LocalSipProxy, "LocalSipProxy Class", kProxyImpls),
    Coclass("NetworkDiagnosticEvent", CLSID_NetworkDiagnosticEvent, "NetworkDiagnosticEvent Class",
            kDiagnosticEventImpls),
};

}  // namespace

const LibraryDesc& NqPortManagerLibrary() {
    static const LibraryDesc library{"NqPortManagerLib", &LIBID_NqPortManagerLib,          1,     0,
                                     LOCALE_NEUTRAL,     "NqPortManager 1.0 Type Library", kTypes};
    return library;
}

}  // namespace automation
