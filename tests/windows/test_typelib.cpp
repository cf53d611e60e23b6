// The type library that widl built from NqPortManager.idl, read back through oleaut32: its LIBID,
// version, every interface and class id of the public header, and the dispatch ids clients use.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include <nqportmanager/NqPortManager.h>

namespace {

// The build tree's path as Wine sees it: drive Z: is the host's root.
std::wstring TypeLibPath() {
    std::wstring path = L"Z:";
    for (const char c : std::string(NQ_TLB_PATH)) {
        path.push_back(c == '/' ? L'\\' : static_cast<wchar_t>(c));
    }
    return path;
}

class TypeLib : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_EQ(LoadTypeLibEx(TypeLibPath().c_str(), REGKIND_NONE, lib_.GetAddressOf()), S_OK);
    }
    ComPtr<ITypeInfo> Info(REFGUID guid) {
        ComPtr<ITypeInfo> info;
        EXPECT_EQ(lib_->GetTypeInfoOfGuid(guid, info.GetAddressOf()), S_OK) << GuidToString(guid);
        return info;
    }
    ComPtr<ITypeLib> lib_;
};

TEST_F(TypeLib, NamesTheLibraryOfTheHeaderAtVersion1) {
    TLIBATTR* attr = nullptr;
    ASSERT_EQ(lib_->GetLibAttr(&attr), S_OK);
    EXPECT_EQ(GuidToString(attr->guid), GuidToString(LIBID_NqPortManagerLib));
    EXPECT_EQ(attr->wMajorVerNum, 1);
    EXPECT_EQ(attr->wMinorVerNum, 0);
    EXPECT_EQ(attr->lcid, 0u);
    lib_->ReleaseTLibAttr(attr);
    BSTR name = nullptr;
    BSTR help = nullptr;
    ASSERT_EQ(lib_->GetDocumentation(-1, &name, &help, nullptr, nullptr), S_OK);
    EXPECT_EQ(Utf8FromBstr(name), "NqPortManagerLib");
    EXPECT_EQ(Utf8FromBstr(help), "NqPortManager 1.0 Type Library");
    SysFreeString(name);
    SysFreeString(help);
}

TEST_F(TypeLib, EveryInterfaceAndClassHasItsKindAndFlags) {
    struct Expected {
        const GUID* guid;
        TYPEKIND kind;
        bool dual;
        const char* name;
    };
    const Expected table[] = {
        {&IID_IAdvancedPortManager, TKIND_DISPATCH, true, "IAdvancedPortManager"},
        {&IID_IPortManagerUpdateEvent, TKIND_DISPATCH, true, "IPortManagerUpdateEvent"},
        {&IID_INetworkDiagnosticEvent, TKIND_DISPATCH, true, "INetworkDiagnosticEvent"},
        {&IID_ILocalSipProxy, TKIND_DISPATCH, true, "ILocalSipProxy"},
        {&IID_INqDiagnostics, TKIND_INTERFACE, false, "INqDiagnostics"},
        {&DIID__IAdvancedPortManagerEvents, TKIND_INTERFACE, false, "_IAdvancedPortManagerEvents"},
        {&CLSID_AdvancedPortManager, TKIND_COCLASS, false, "AdvancedPortManager"},
        {&CLSID_LocalSipProxy, TKIND_COCLASS, false, "LocalSipProxy"},
        {&CLSID_NetworkDiagnosticEvent, TKIND_COCLASS, false, "NetworkDiagnosticEvent"},
    };
    for (const Expected& e : table) {
        SCOPED_TRACE(e.name);
        ComPtr<ITypeInfo> info = Info(*e.guid);
        ASSERT_TRUE(info);
        TYPEATTR* attr = nullptr;
        ASSERT_EQ(info->GetTypeAttr(&attr), S_OK);
        EXPECT_EQ(attr->typekind, e.kind);
        EXPECT_EQ((attr->wTypeFlags & TYPEFLAG_FDUAL) != 0, e.dual);
        info->ReleaseTypeAttr(attr);
        BSTR name = nullptr;
        ASSERT_EQ(info->GetDocumentation(MEMBERID_NIL, &name, nullptr, nullptr, nullptr), S_OK);
        EXPECT_EQ(Utf8FromBstr(name), e.name);
        SysFreeString(name);
    }
}

// What IDispatch::GetIDsOfNames answers from this library, member by member.
TEST_F(TypeLib, DispatchIdsAreThoseClientsUse) {
    struct Member {
        const GUID* iid;
        const char* name;
        DISPID id;
    };
    const Member table[] = {
        {&IID_IAdvancedPortManager, "Shutdown", 2},
        {&IID_IAdvancedPortManager, "InitializeEx", 3},
        {&IID_IAdvancedPortManager, "StunServer", 4},
        {&IID_IAdvancedPortManager, "StartingPort", 5},
        {&IID_IAdvancedPortManager, "NumberOfPorts", 6},
        {&IID_IAdvancedPortManager, "State", 7},
        {&IID_IAdvancedPortManager, "Topology", 8},
        {&IID_IAdvancedPortManager, "InitiateShutdown", 9},
        {&IID_IAdvancedPortManager, "RecommendedPortManager", 10},
        {&IID_IAdvancedPortManager, "RecommendedSipServer", 11},
        {&IID_IAdvancedPortManager, "RecommendedUpnpEnabled", 12},
        {&IID_IAdvancedPortManager, "OnBeforeEnableProfile", 13},
        {&IID_IAdvancedPortManager, "OnBeforeDisableProfile", 14},
        {&IID_IAdvancedPortManager, "InitializeEx2", 15},
        {&IID_IAdvancedPortManager, "ClientNameSuffix", 16},
        {&IID_IAdvancedPortManager, "PrivateIpAddress", 17},
        {&IID_IAdvancedPortManager, "PublicIpAddress", 18},
        {&IID_IAdvancedPortManager, "Refresh", 19},
        {&IID_IAdvancedPortManager, "OnBeforeEnableProfileEx", 20},
        {&IID_IAdvancedPortManager, "DiagnoseNetwork", 21},
        {&IID_IAdvancedPortManager, "UDPPacketsIn", 22},
        {&IID_IAdvancedPortManager, "ErrorCanBeDiagnosed", 23},
        {&IID_IPortManagerUpdateEvent, "PortManager", 1},
        {&IID_INetworkDiagnosticEvent, "errorCode", 1},
        {&IID_INetworkDiagnosticEvent, "ErrorText", 2},
        {&IID_INetworkDiagnosticEvent, "TestType", 3},
        {&IID_INetworkDiagnosticEvent, "TestTypeText", 4},
        {&IID_INetworkDiagnosticEvent, "AdditionalInfo", 5},
        {&IID_INetworkDiagnosticEvent, "cookie", 6},
        {&IID_ILocalSipProxy, "InternalAddress", 1},
        {&IID_ILocalSipProxy, "SenderEndpoint", 2},
        {&IID_ILocalSipProxy, "Start", 3},
        {&IID_ILocalSipProxy, "Stop", 4},
        {&DIID__IAdvancedPortManagerEvents, "Event", 1},
    };
    for (const Member& m : table) {
        SCOPED_TRACE(m.name);
        ComPtr<ITypeInfo> info = Info(*m.iid);
        ASSERT_TRUE(info);
        BStr name(m.name);
        LPOLESTR names[] = {name.Get()};
        MEMBERID id = DISPID_UNKNOWN;
        ASSERT_EQ(info->GetIDsOfNames(names, 1, &id), S_OK);
        EXPECT_EQ(id, m.id);
    }
    // Nothing beyond the listing: the methods of IAdvancedPortManager after IDispatch's.
    ComPtr<ITypeInfo> info = Info(IID_IAdvancedPortManager);
    TYPEATTR* attr = nullptr;
    ASSERT_EQ(info->GetTypeAttr(&attr), S_OK);
    EXPECT_EQ(attr->cFuncs, 22 + 7);
    info->ReleaseTypeAttr(attr);
}

}  // namespace
