// The type library that widl built from NqPortManager.idl, read back through oleaut32: its LIBID,
// version, every interface and class id of the public header, and the agreement of every type and
// member with the library's description.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include <nqportmanager/NqPortManager.h>

#include "automation/NqPortManagerLib.h"

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
std::string Narrow(BSTR text) {
    std::string narrow;
    for (UINT i = 0; text != nullptr && i < SysStringLen(text); ++i) {
        narrow.push_back(static_cast<char>(text[i]));
    }
    return narrow;
}

std::string NameOf(ITypeInfo* info, MEMBERID id) {
    BSTR name = nullptr;
    info->GetDocumentation(id, &name, nullptr, nullptr, nullptr);
    std::string narrow = Narrow(name);
    SysFreeString(name);
    return narrow;
}

// What a description's type reference reads as in a compiled library; interfaces are left out,
// the IDL may name them through IDispatch.
VARTYPE Compiled(const TYPEDESC& t, bool out) {
    return out && t.vt == VT_PTR ? t.lptdesc->vt : t.vt;
}

// The library widl built from the IDL and the description that the other builds serve IDispatch
// from agree type for type and member for member: kinds, ids, DISPIDs, invoke kinds, parameter
// counts and types, enumeration values, the classes' interfaces and their flags.
TEST_F(TypeLib, AgreesMemberForMemberWithTheDescription) {
    const automation::LibraryDesc& library = automation::NqPortManagerLibrary();
    for (const automation::TypeDesc& type : library.types) {
        SCOPED_TRACE(type.name);
        ComPtr<ITypeInfo> info;
        MEMBERID id = 0;
        USHORT found = 1;
        BStr name(type.name);
        ASSERT_EQ(lib_->FindName(name.Get(), 0, info.GetAddressOf(), &id, &found), S_OK);
        ASSERT_TRUE(info) << "not in the IDL";
        TYPEATTR* attr = nullptr;
        ASSERT_EQ(info->GetTypeAttr(&attr), S_OK);
        if (attr->typekind == TKIND_DISPATCH && (attr->wTypeFlags & TYPEFLAG_FDUAL) != 0) {
            HREFTYPE vtable = 0;  // the dual interface's own view
            ComPtr<ITypeInfo> view;
            ASSERT_EQ(info->GetRefTypeOfImplType(static_cast<UINT>(-1), &vtable), S_OK);
            ASSERT_EQ(info->GetRefTypeInfo(vtable, view.GetAddressOf()), S_OK);
            info->ReleaseTypeAttr(attr);
            info = view;
            ASSERT_EQ(info->GetTypeAttr(&attr), S_OK);
        }
        EXPECT_EQ(attr->typekind, type.kind);
        if (type.guid != nullptr) {
            EXPECT_EQ(GuidToString(attr->guid), GuidToString(*type.guid));
        }
        EXPECT_EQ(attr->cFuncs, type.members.size());
        EXPECT_EQ(attr->cVars, type.values.size());
        if (type.kind == TKIND_COCLASS) {  // an interface's base is only in its flags there
            EXPECT_EQ(attr->cImplTypes, type.impls.size());
        }
        // Off IDispatch a member id means nothing: such members are matched by name.
        const bool byName = type.baseSlots == 3;
        for (const automation::MemberDesc& m : type.members) {
            SCOPED_TRACE(m.name);
            bool matched = false;
            for (UINT i = 0; i < attr->cFuncs && !matched; ++i) {
                FUNCDESC* f = nullptr;
                ASSERT_EQ(info->GetFuncDesc(i, &f), S_OK);
                if ((byName ? NameOf(info.Get(), f->memid) == m.name : f->memid == m.dispid) &&
                    f->invkind == m.kind) {
                    matched = true;
                    EXPECT_EQ(NameOf(info.Get(), f->memid), m.name);
                    ASSERT_EQ(static_cast<size_t>(f->cParams), m.params.size());
                    for (size_t p = 0; p < m.params.size(); ++p) {
                        const automation::TypeRef& t = m.params[p].type;
                        if (t.vt != VT_DISPATCH && t.vt != VT_UNKNOWN &&
                            !(t.vt == VT_USERDEFINED && t.userType[0] == 'I')) {
                            EXPECT_EQ(Compiled(f->lprgelemdescParam[p].tdesc, t.out), t.vt)
                                << m.params[p].name;
                        }
                    }
                }
                info->ReleaseFuncDesc(f);
            }
            EXPECT_TRUE(matched) << "no member with DISPID " << m.dispid << " of that kind";
        }
        for (UINT i = 0; i < attr->cVars; ++i) {
            VARDESC* v = nullptr;
            ASSERT_EQ(info->GetVarDesc(i, &v), S_OK);
            const std::string constant = NameOf(info.Get(), v->memid);
            bool matched = false;
            for (const automation::EnumValue& e : type.values) {
                if (constant == e.name) {
                    matched = true;
                    EXPECT_EQ(v->lpvarValue->lVal, e.value) << constant;
                }
            }
            EXPECT_TRUE(matched) << constant << " is not in the description";
            info->ReleaseVarDesc(v);
        }
        for (UINT i = 0; type.kind == TKIND_COCLASS && i < type.impls.size(); ++i) {
            HREFTYPE ref = 0;
            ComPtr<ITypeInfo> implemented;
            INT flags = 0;
            ASSERT_EQ(info->GetRefTypeOfImplType(i, &ref), S_OK);
            ASSERT_EQ(info->GetRefTypeInfo(ref, implemented.GetAddressOf()), S_OK);
            EXPECT_EQ(NameOf(implemented.Get(), MEMBERID_NIL), type.impls[i].interfaceName);
            ASSERT_EQ(info->GetImplTypeFlags(i, &flags), S_OK);
            EXPECT_EQ(flags, type.impls[i].flags) << type.impls[i].interfaceName;
        }
        info->ReleaseTypeAttr(attr);
    }
}

}  // namespace
