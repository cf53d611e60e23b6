// Late binding as a scripting client sees it: the module's type library, and IDispatch of its
// objects and events driven by member names only.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include <nqportmanager/NqPortManager.h>
#include <nqportmanager/client.h>

#include "automation/Invoke.h"

namespace {

using namespace std::literals;

const std::string kModule = std::string(NQPM_BINARY_DIR) + "/lib/libNqPortManager.so";

VARIANT Str(std::u16string_view text) {
    VARIANT v;
    v.vt = VT_BSTR;
    v.bstrVal = SysAllocStringLen(text.data(), static_cast<UINT>(text.size()));
    return v;
}
VARIANT I4(LONG value) {
    VARIANT v;
    v.vt = VT_I4;
    v.lVal = value;
    return v;
}
VARIANT Of(VARTYPE vt) {
    VARIANT v;
    v.vt = vt;
    v.scode = DISP_E_PARAMNOTFOUND;  // VT_ERROR: the "missing" marker
    return v;
}
VARIANT Object(IUnknown* object) {
    VARIANT v;
    v.vt = VT_UNKNOWN;
    v.punkVal = object;
    object->AddRef();
    return v;
}

struct Outcome {
    HRESULT hr;
    VARIANT value;
    UINT argErr;
    EXCEPINFO info;
    std::string Text() const { return value.vt == VT_BSTR ? Utf8FromBstr(value.bstrVal) : ""; }
};

// Keeps the IDispatch* of every event, as a script's event handler would.
struct EventSink final : _IAdvancedPortManagerEvents {
    HRESULT QueryInterface(REFIID riid, void** ppv) override {
        *ppv = riid == IID_IUnknown || riid == DIID__IAdvancedPortManagerEvents ? this : nullptr;
        return *ppv != nullptr ? S_OK : E_NOINTERFACE;
    }
    ULONG AddRef() override { return 2; }
    ULONG Release() override { return 1; }
    HRESULT Event(PM_EVENT type, IDispatch* event) override {
        events.push_back({type, ComPtr<IDispatch>(event)});
        return S_OK;
    }
    std::vector<std::pair<PM_EVENT, ComPtr<IDispatch>>> events;
};

class Automation : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_EQ(nqportmanager::Module::Load(kModule, module_), S_OK);
        ASSERT_EQ(module_.LoadTypeLibrary(library_.GetAddressOf()), S_OK);
    }
    void TearDown() override {
        for (Outcome& o : outcomes_) {
            VariantClear(&o.value);
            SysFreeString(o.info.bstrSource);
            SysFreeString(o.info.bstrDescription);
        }
        library_.Reset();
        // Unloading also closes the module's message queue of this thread.
        EXPECT_TRUE(module_.Unload()) << "a test left an object of the module alive";
    }
    ComPtr<IDispatch> Create(REFCLSID clsid) {
        ComPtr<IDispatch> object;
        EXPECT_EQ(module_.CreateInstance(clsid, nullptr, IID_IDispatch, object.GetVoidAddressOf()),
                  S_OK);
        return object;
    }
    DISPID IdOf(IDispatch* object, const char* name) {
        BStr text(name);
        LPOLESTR names[] = {text.Get()};
        DISPID id = 0;
        EXPECT_EQ(object->GetIDsOfNames(GUID_NULL, names, 1, LOCALE_USER_DEFAULT, &id), S_OK)
            << name;
        return id;
    }
    // args in the member's order; they are consumed. A put names its value DISPID_PROPERTYPUT.
    Outcome& Call(IDispatch* object, const char* name, WORD flags, std::vector<VARIANT> args = {},
                  DISPID id = DISPID_UNKNOWN) {
        std::vector<VARIANT> reversed(args.rbegin(), args.rend());
        DISPID put = DISPID_PROPERTYPUT;
        DISPPARAMS params{reversed.data(), &put, static_cast<UINT>(reversed.size()),
                          flags == DISPATCH_PROPERTYPUT ? 1u : 0u};
        Outcome& o = outcomes_.emplace_back(Outcome{E_FAIL, {}, 99, {}});
        o.hr = object->Invoke(name != nullptr ? IdOf(object, name) : id, GUID_NULL, 0, flags,
                              &params, &o.value, &o.info, &o.argErr);
        for (VARIANT& v : reversed) {
            VariantClear(&v);
        }
        return o;
    }
    LONG Long(IDispatch* object, const char* name) {
        const Outcome& o = Call(object, name, DISPATCH_PROPERTYGET);
        EXPECT_EQ(o.hr, S_OK) << name;
        EXPECT_EQ(o.value.vt, VT_I4) << name;
        return o.value.lVal;
    }

    nqportmanager::Module module_;
    ComPtr<ITypeLib> library_;
    std::vector<Outcome> outcomes_;
};

// One derived virtual member more: its slot is the interface's vtable size.
struct PortManagerProbe : IAdvancedPortManager {
    virtual void Next() {}
};
struct UpdateEventProbe : IPortManagerUpdateEvent {
    virtual void Next() {}
};
struct DiagnosticEventProbe : INetworkDiagnosticEvent {
    virtual void Next() {}
};
struct ProxyProbe : ILocalSipProxy {
    virtual void Next() {}
};

TEST_F(Automation, EveryMemberHasTheListedDispidAndItsVtableSlot) {
    struct Listing {
        const IID* iid;
        SHORT slots;                                          // from the C++ declaration
        std::vector<std::pair<const char*, DISPID>> members;  // vtable order
    };
    const Listing listings[] = {
        {&IID_IAdvancedPortManager,
         automation::VtableOffset<&PortManagerProbe::Next>(),
         {{"Shutdown", 2},
          {"InitializeEx", 3},
          {"StunServer", 4},
          {"StartingPort", 5},
          {"NumberOfPorts", 6},
          {"State", 7},
          {"Topology", 8},
          {"InitiateShutdown", 9},
          {"RecommendedPortManager", 10},
          {"RecommendedSipServer", 11},
          {"RecommendedUpnpEnabled", 12},
          {"OnBeforeEnableProfile", 13},
          {"OnBeforeDisableProfile", 14},
          {"InitializeEx2", 15},
          {"ClientNameSuffix", 16},
          {"PrivateIpAddress", 17},
          {"PublicIpAddress", 18},
          {"Refresh", 19},
          {"OnBeforeEnableProfileEx", 20},
          {"DiagnoseNetwork", 21},
          {"UDPPacketsIn", 22},
          {"ErrorCanBeDiagnosed", 23}}},
        {&IID_IPortManagerUpdateEvent,
         automation::VtableOffset<&UpdateEventProbe::Next>(),
         {{"PortManager", 1}, {"PortManager", 1}}},
        {&IID_INetworkDiagnosticEvent,
         automation::VtableOffset<&DiagnosticEventProbe::Next>(),
         {{"errorCode", 1},
          {"ErrorText", 2},
          {"TestType", 3},
          {"TestTypeText", 4},
          {"AdditionalInfo", 5},
          {"cookie", 6}}},
        {&IID_ILocalSipProxy,
         automation::VtableOffset<&ProxyProbe::Next>(),
         {{"InternalAddress", 1},
          {"InternalAddress", 1},
          {"SenderEndpoint", 2},
          {"Start", 3},
          {"Stop", 4}}},
    };
    for (const Listing& l : listings) {
        ComPtr<ITypeInfo> info;
        ASSERT_EQ(library_->GetTypeInfoOfGuid(*l.iid, info.GetAddressOf()), S_OK);
        TYPEATTR* attr = nullptr;
        ASSERT_EQ(info->GetTypeAttr(&attr), S_OK);
        EXPECT_EQ(attr->cFuncs, l.members.size());
        EXPECT_EQ(attr->cbSizeVft, l.slots) << "a member is missing from the description";
        EXPECT_EQ(attr->wTypeFlags & TYPEFLAG_FDUAL, TYPEFLAG_FDUAL);
        info->ReleaseTypeAttr(attr);
        for (size_t i = 0; i < l.members.size(); ++i) {
            const auto& [name, dispid] = l.members[i];
            FUNCDESC* func = nullptr;
            ASSERT_EQ(info->GetFuncDesc(static_cast<UINT>(i), &func), S_OK);
            BStr described;
            info->GetDocumentation(func->memid, described.Out(), nullptr, nullptr, nullptr);
            EXPECT_EQ(described.Utf8(), name);
            EXPECT_EQ(func->memid, dispid) << name;
            EXPECT_EQ(func->oVft, static_cast<SHORT>((7 + i) * sizeof(void*))) << name;
            info->ReleaseFuncDesc(func);
            std::string lower(name);
            for (char& c : lower) {
                c = static_cast<char>(std::tolower(c));
            }
            BStr asked(lower);
            LPOLESTR names[] = {asked.Get()};
            DISPID found = 0;
            EXPECT_EQ(info->GetIDsOfNames(names, 1, &found), S_OK) << lower;
            EXPECT_EQ(found, dispid) << lower;
        }
    }
}

TEST_F(Automation, InvokeDrivesThePortManagerTheProxyAndBothEventsByName) {
    ComPtr<IDispatch> pm = Create(CLSID_AdvancedPortManager);
    ASSERT_TRUE(pm);
    EventSink sink;
    ComPtr<IConnectionPointContainer> container = pm.As<IConnectionPointContainer>();
    ComPtr<IConnectionPoint> point;
    DWORD cookie = 0;
    ASSERT_EQ(
        container->FindConnectionPoint(DIID__IAdvancedPortManagerEvents, point.GetAddressOf()),
        S_OK);
    ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);

    // Both discovery switches and the refresh policy by name, in an order of their own; the
    // first five in order.
    const char* const kNames[] = {"initializeex2",    "vbForceStunDisabled", "VBFORCEUPNPDISABLED",
                                  "lRefreshInterval", "vbRefreshSIP",        "vbRefreshAudio",
                                  "vbRefreshVideo"};
    std::vector<BStr> texts(std::begin(kNames), std::end(kNames));
    std::vector<LPOLESTR> names;
    for (BStr& t : texts) {
        names.push_back(t.Get());
    }
    DISPID ids[7] = {};
    ASSERT_EQ(pm->GetIDsOfNames(GUID_NULL, names.data(), 7, 0, ids), S_OK);
    EXPECT_EQ(ids[0], 15);
    EXPECT_EQ(ids[1], 6);
    EXPECT_EQ(ids[2], 5);
    VARIANT yes = Of(VT_BOOL);
    yes.boolVal = VARIANT_TRUE;
    // rgvarg: the named ones in the order of their ids, then the positional ones reversed.
    std::vector<VARIANT> rgvarg = {yes,    Str(u"-1"),   I4(30000),         I4(1),
                                   I4(1),  I4(0),        Str(u"127.0.0.1"), Str(u"127.0.0.1"),
                                   I4(16), Str(u"5004"), Str(u"127.0.0.1")};
    DISPPARAMS params{rgvarg.data(), ids + 1, 11, 6};
    VARIANT result;
    VariantInit(&result);
    EXPECT_EQ(pm->Invoke(ids[0], GUID_NULL, 0, DISPATCH_METHOD, &params, &result, nullptr, nullptr),
              S_OK);
    EXPECT_EQ(result.vt, VT_EMPTY);
    for (VARIANT& v : rgvarg) {
        VariantClear(&v);
    }
    EXPECT_EQ(Long(pm.Get(), "State"), PMS_COMPLETED);
    EXPECT_GE(Long(pm.Get(), "Topology"), PMT_UNKNOWN);
    EXPECT_EQ(Call(pm.Get(), "RecommendedSipServer", DISPATCH_PROPERTYGET).value.vt, VT_BSTR);

    ASSERT_EQ(sink.events.size(), 1u);
    EXPECT_EQ(sink.events[0].first, PME_UPDATED);
    const Outcome& owner = Call(sink.events[0].second.Get(), "PortManager", DISPATCH_PROPERTYGET);
    ASSERT_EQ(owner.value.vt, VT_DISPATCH);
    EXPECT_EQ(ComPtr<IDispatch>(owner.value.pdispVal).As<IUnknown>(), pm.As<IUnknown>());

    // A well-known address that is a name ends the run at its first test, without traffic.
    EXPECT_EQ(Call(pm.Get(), "DiagnoseNetwork", DISPATCH_METHOD,
                   {Str(u"localhost"), Str(u"127.0.0.1"), Str(u"127.0.0.1"), Str(u"7000"), I4(100),
                    I4(9)})
                  .hr,
              S_OK);
    module_.RunMessageLoopUntil(
        [](void* s) { return static_cast<EventSink*>(s)->events.size() > 1 ? 1 : 0; }, &sink,
        10000);
    ASSERT_EQ(sink.events.size(), 2u);
    EXPECT_EQ(sink.events[1].first, PME_DIAGNOSTIC_COMPLETED);
    IDispatch* diagnostic = sink.events[1].second.Get();
    EXPECT_EQ(Long(diagnostic, "errorCode"), PMDR_TIMEOUT);
    EXPECT_EQ(Long(diagnostic, "TestType"), PMNTT_TEST_LOCATE_INTERFACE);
    EXPECT_EQ(Long(diagnostic, "cookie"), 9);
    for (const char* text : {"ErrorText", "TestTypeText", "AdditionalInfo"}) {
        EXPECT_EQ(Call(diagnostic, text, DISPATCH_PROPERTYGET).value.vt, VT_BSTR) << text;
    }
    EXPECT_FALSE(Call(diagnostic, "ErrorText", DISPATCH_PROPERTYGET).Text().empty());
    EXPECT_EQ(Call(pm.Get(), "Shutdown", DISPATCH_METHOD).hr, S_OK);
    EXPECT_EQ(point->Unadvise(cookie), S_OK);
    sink.events.clear();

    ComPtr<IDispatch> proxy = Create(CLSID_LocalSipProxy);
    EXPECT_EQ(Call(proxy.Get(), "InternalAddress", DISPATCH_PROPERTYPUT, {Str(u"127.0.0.1")}).hr,
              S_OK);
    EXPECT_EQ(Call(proxy.Get(), "InternalAddress", DISPATCH_PROPERTYGET).Text(), "127.0.0.1");
}

TEST_F(Automation, ArgumentsAreChangedToTheirTypeOrRefusedWithTheirIndex) {
    ComPtr<IDispatch> pm = Create(CLSID_AdvancedPortManager);
    ComPtr<IDispatch> proxy = Create(CLSID_LocalSipProxy);
    IDispatch* p = pm.Get();
    struct Case {
        IDispatch* object;
        const char* member;
        WORD flags;
        std::vector<VARIANT> args;
        HRESULT hr;
        UINT argErr;  // 99: untouched
    };
    const WORD kCall = DISPATCH_METHOD;
    std::vector<Case> cases;
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {Str(u" 42 ")}, S_OK, 99});
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {Of(VT_EMPTY)}, S_OK, 99});
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {Of(VT_BOOL)}, S_OK, 99});
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {Str(u"4x2")}, DISP_E_TYPEMISMATCH, 0});
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {Str(u"4\0002"sv)}, DISP_E_TYPEMISMATCH, 0});
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {Str(u"99999999999")}, DISP_E_OVERFLOW, 0});
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {Of(VT_NULL)}, DISP_E_TYPEMISMATCH, 0});
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {Of(VT_ERROR)}, DISP_E_PARAMNOTOPTIONAL, 0});
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {}, DISP_E_BADPARAMCOUNT, 99});
    cases.push_back({p, "ErrorCanBeDiagnosed", kCall, {I4(1), I4(2)}, DISP_E_BADPARAMCOUNT, 99});
    cases.push_back({p,
                     "DiagnoseNetwork",
                     kCall,
                     {Str(u"a"), Str(u"b"), Str(u"c"), Str(u"port"), I4(1), I4(1)},
                     DISP_E_TYPEMISMATCH,
                     2});
    cases.push_back({p, "State", DISPATCH_PROPERTYPUT, {I4(1)}, DISP_E_MEMBERNOTFOUND, 99});
    cases.push_back({p, "State", kCall, {}, DISP_E_MEMBERNOTFOUND, 99});
    cases.push_back({p, "Shutdown", DISPATCH_PROPERTYGET, {}, DISP_E_MEMBERNOTFOUND, 99});
    cases.push_back({p, "Refresh", kCall, {}, DISP_E_EXCEPTION, 99});  // before InitializeEx2
    cases.push_back({p, "State", 0x10, {}, E_INVALIDARG, 99});
    IDispatch* x = proxy.Get();
    cases.push_back(
        {x, "Start", kCall, {Of(VT_EMPTY), I4(1), I4(2), I4(0)}, DISP_E_TYPEMISMATCH, 3});
    cases.push_back(
        {x, "Start", kCall, {Object(proxy.Get()), I4(1), I4(2), I4(0)}, DISP_E_TYPEMISMATCH, 3});
    cases.push_back(
        {x, "Start", kCall, {Object(p), I4(1), Str(u"max"), I4(0)}, DISP_E_TYPEMISMATCH, 1});
    cases.push_back(
        {x, "InternalAddress", DISPATCH_PROPERTYPUT, {Str(u"127.0.0.1\0x"sv)}, S_OK, 99});
    cases.push_back({x, "InternalAddress", DISPATCH_PROPERTYPUT, {}, E_INVALIDARG, 99});
    for (Case& c : cases) {
        const size_t count = c.args.size();
        const Outcome& o = Call(c.object, c.member, c.flags, std::move(c.args));
        EXPECT_EQ(o.hr, c.hr) << c.member << " with " << count << " arguments";
        EXPECT_EQ(o.argErr, c.argErr) << c.member << " with " << count << " arguments";
    }
    EXPECT_EQ(outcomes_[0].value.vt, VT_BOOL);
    EXPECT_EQ(outcomes_[14].info.scode, E_FAIL);

    // Refusals before any member is reached.
    DISPPARAMS none{nullptr, nullptr, 0, 0};
    DISPPARAMS inconsistent{nullptr, nullptr, 1, 0};
    EXPECT_EQ(p->Invoke(7, GUID_NULL, 0, DISPATCH_PROPERTYGET, nullptr, nullptr, nullptr, nullptr),
              E_POINTER);
    EXPECT_EQ(
        p->Invoke(7, GUID_NULL, 0, DISPATCH_PROPERTYGET, &inconsistent, nullptr, nullptr, nullptr),
        E_INVALIDARG);
    EXPECT_EQ(p->Invoke(7, IID_IUnknown, 0, DISPATCH_PROPERTYGET, &none, nullptr, nullptr, nullptr),
              DISP_E_UNKNOWNINTERFACE);
    EXPECT_EQ(
        p->Invoke(7, GUID_NULL, 0xFFFFFFFF, DISPATCH_PROPERTYGET, &none, nullptr, nullptr, nullptr),
        DISP_E_UNKNOWNLCID);
    EXPECT_EQ(p->Invoke(999, GUID_NULL, 0, DISPATCH_METHOD, &none, nullptr, nullptr, nullptr),
              DISP_E_MEMBERNOTFOUND);
    EXPECT_EQ(p->Invoke(7, GUID_NULL, 0, DISPATCH_PROPERTYGET, &none, nullptr, nullptr, nullptr),
              S_OK);  // a result nobody asked for is freed

    BStr start("START"), minPort("minport"), unknown("nope");
    LPOLESTR names[] = {start.Get(), minPort.Get(), unknown.Get()};
    DISPID ids[3] = {};
    EXPECT_EQ(x->GetIDsOfNames(GUID_NULL, names, 2, 0, ids), S_OK);
    EXPECT_EQ(ids[0], 3);
    EXPECT_EQ(ids[1], 1);
    EXPECT_EQ(x->GetIDsOfNames(GUID_NULL, names, 3, 0, ids), DISP_E_UNKNOWNNAME);
    EXPECT_EQ(ids[2], DISPID_UNKNOWN);
    EXPECT_EQ(x->GetIDsOfNames(GUID_NULL, names + 2, 1, 0, ids), DISP_E_UNKNOWNNAME);
    EXPECT_EQ(ids[0], DISPID_UNKNOWN);
    EXPECT_EQ(x->GetIDsOfNames(GUID_NULL, nullptr, 1, 0, ids), E_POINTER);
    EXPECT_EQ(x->GetIDsOfNames(GUID_NULL, names, 1, 0xFFFFFFFF, ids), DISP_E_UNKNOWNLCID);
    UINT count = 0;
    ComPtr<ITypeInfo> info;
    EXPECT_EQ(x->GetTypeInfoCount(&count), S_OK);
    EXPECT_EQ(count, 1u);
    EXPECT_EQ(x->GetTypeInfo(1, 0, info.GetAddressOf()), DISP_E_BADINDEX);
    EXPECT_EQ(x->GetTypeInfo(0, 0, nullptr), E_POINTER);
}

// A member that leaves error info: its texts reach the EXCEPINFO, and stale info does not.
struct IFailing : IUnknown {
    virtual HRESULT Fail(LONG code, VARIANT_BOOL describe) = 0;
};
struct Failing final : IFailing {
    HRESULT QueryInterface(REFIID, void**) override { return E_NOINTERFACE; }
    ULONG AddRef() override { return 1; }
    ULONG Release() override { return 1; }
    HRESULT Fail(LONG code, VARIANT_BOOL describe) override {
        ComPtr<ICreateErrorInfo> create;
        static char16_t kText[] = u"no such port";
        if (describe != VARIANT_FALSE && SUCCEEDED(CreateErrorInfo(create.GetAddressOf()))) {
            ComPtr<IErrorInfo> info;
            create->SetDescription(kText);
            create->QueryInterface(IID_IErrorInfo, info.GetVoidAddressOf());
            SetErrorInfo(0, info.Get());
        }
        return code;
    }
};

TEST(AutomationInvoke, FailingMemberGivesDispExceptionWithItsErrorInfo) {
    static constexpr automation::ParamDesc kParams[] = {{"code", {VT_I4}}, {"describe", {VT_BOOL}}};
    static constexpr automation::MemberDesc kMembers[] = {
        automation::MakeMember<&IFailing::Fail>("Fail", 1, INVOKE_FUNC, kParams)};
    static constexpr automation::TypeDesc kType{TKIND_INTERFACE, "IFailing", &GUID_NULL, 0, nullptr,
                                                kMembers,        {},         {},         3};
    static constexpr automation::LibraryDesc kLibrary{"Test", &GUID_NULL, 1,          0,
                                                      0,      nullptr,    {&kType, 1}};
    Failing object;
    for (const bool describe : {true, false}) {
        VARIANT args[2] = {Of(VT_BOOL), I4(E_ACCESSDENIED)};
        args[0].boolVal = describe ? VARIANT_TRUE : VARIANT_FALSE;
        DISPPARAMS params{args, nullptr, 2, 0};
        EXCEPINFO info{};
        Failing other;
        other.Fail(S_OK, VARIANT_TRUE);  // stale info of an earlier call
        EXPECT_EQ(automation::InvokeMember(kLibrary, kType, static_cast<IFailing*>(&object), 1,
                                           DISPATCH_METHOD, &params, nullptr, &info, nullptr),
                  DISP_E_EXCEPTION);
        EXPECT_EQ(info.scode, E_ACCESSDENIED);
        EXPECT_EQ(Utf8FromBstr(info.bstrDescription), describe ? "no such port" : "");
        SysFreeString(info.bstrDescription);
        SysFreeString(info.bstrSource);
    }
}

TEST(AutomationVariant, ChangeTypeConvertsTheTypesUsedHereAndRefusesTheRest) {
    struct Case {
        VARIANT from;
        USHORT flags;
        VARTYPE to;
        HRESULT hr;
        std::string text;  // the result as a BSTR when to is VT_BSTR, else its lVal or boolVal
    };
    VARIANT flag = Of(VT_BOOL);
    flag.boolVal = VARIANT_TRUE;
    const Case cases[] = {
        {I4(-7), 0, VT_BSTR, S_OK, "-7"},
        {flag, 0, VT_BSTR, S_OK, "-1"},
        {flag, VARIANT_ALPHABOOL, VT_BSTR, S_OK, "True"},
        {Of(VT_EMPTY), 0, VT_BSTR, S_OK, ""},
        {I4(70000), 0, VT_I2, DISP_E_OVERFLOW, ""},
        {I4(-1), 0, VT_UI4, DISP_E_OVERFLOW, ""},
        {I4(2), 0, VT_BOOL, S_OK, "-1"},
        {Of(VT_ERROR), 0, VT_I4, DISP_E_TYPEMISMATCH, ""},
        {I4(1), 0, VT_UNKNOWN, DISP_E_TYPEMISMATCH, ""},
        {I4(1), 0, VT_I4 | VT_BYREF, DISP_E_BADVARTYPE, ""},
    };
    for (const Case& c : cases) {
        VARIANT out;
        VariantInit(&out);
        EXPECT_EQ(VariantChangeType(&out, &c.from, c.flags, c.to), c.hr) << c.text;
        if (SUCCEEDED(c.hr)) {
            EXPECT_EQ(c.to == VT_BSTR   ? Utf8FromBstr(out.bstrVal)
                      : c.to == VT_BOOL ? std::to_string(out.boolVal)
                                        : std::to_string(out.lVal),
                      c.text);
        }
        EXPECT_EQ(out.vt, SUCCEEDED(c.hr) ? c.to : VARTYPE{VT_EMPTY});
        VariantClear(&out);
    }
    // In place, and through a reference.
    VARIANT v = Str(u" 12 ");
    EXPECT_EQ(VariantChangeType(&v, &v, 0, VT_I4), S_OK);
    EXPECT_EQ(v.vt, VT_I4);
    LONG value = 5;
    VARIANT ref = Of(VT_I4 | VT_BYREF);
    ref.byref = &value;
    EXPECT_EQ(VariantChangeType(&v, &ref, 0, VT_BSTR), S_OK);
    EXPECT_EQ(Utf8FromBstr(v.bstrVal), "5");
    VariantClear(&v);
    EXPECT_EQ(VariantChangeType(nullptr, &ref, 0, VT_I4), E_INVALIDARG);
}

TEST_F(Automation, TypeInfoWalkGivesTheEnumerationsAndTheLibrary) {
    struct Expected {
        const char* name;
        UINT count;
        const char* last;
    };
    const Expected expected[] = {
        {"PM_STATE", 3, "PMS_COMPLETED"},
        {"PM_TOPOLOGY", 10, "PMT_UPNP_ENABLED_NAT_OR_FIREWALL"},
        {"PM_EVENT", 4, "PME_DIAGNOSTIC_COMPLETED"},
        {"PM_DIAGNOSTIC_RESULT", 44, "PMDR_ECHO_SERVER_LAST_ERROR"},
        {"PM_DIAGNOSTIC_TEST_TYPE", 12, "PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET"},
    };
    size_t seen = 0;
    for (UINT t = 0; t < library_->GetTypeInfoCount(); ++t) {
        TYPEKIND kind;
        ASSERT_EQ(library_->GetTypeInfoType(t, &kind), S_OK);
        if (kind != TKIND_ENUM) {
            continue;
        }
        ComPtr<ITypeInfo> info;
        ASSERT_EQ(library_->GetTypeInfo(t, info.GetAddressOf()), S_OK);
        BStr name;
        info->GetDocumentation(MEMBERID_NIL, name.Out(), nullptr, nullptr, nullptr);
        ASSERT_LT(seen, std::size(expected));
        const Expected& e = expected[seen++];
        EXPECT_EQ(name.Utf8(), e.name);
        TYPEATTR* attr = nullptr;
        ASSERT_EQ(info->GetTypeAttr(&attr), S_OK);
        EXPECT_EQ(attr->cVars, e.count) << e.name;
        for (UINT i = 0; i < attr->cVars; ++i) {
            VARDESC* var = nullptr;
            ASSERT_EQ(info->GetVarDesc(i, &var), S_OK);
            EXPECT_EQ(var->varkind, VAR_CONST);
            EXPECT_EQ(var->lpvarValue->lVal, static_cast<LONG>(i)) << e.name;  // 0, 1, 2, ...
            BStr member;
            UINT got = 0;
            ASSERT_EQ(info->GetNames(var->memid, member.Out(), 1, &got), S_OK);
            if (i + 1 == attr->cVars) {
                EXPECT_EQ(member.Utf8(), e.last);
            }
            info->ReleaseVarDesc(var);
        }
        info->ReleaseTypeAttr(attr);
    }
    EXPECT_EQ(seen, std::size(expected));

    // An enumeration parameter leads to its type; the library names itself.
    ComPtr<ITypeInfo> pm, state;
    ASSERT_EQ(library_->GetTypeInfoOfGuid(IID_IAdvancedPortManager, pm.GetAddressOf()), S_OK);
    FUNCDESC* func = nullptr;
    ASSERT_EQ(pm->GetFuncDesc(5, &func), S_OK);
    ASSERT_EQ(func->lprgelemdescParam[0].tdesc.vt, VT_PTR);
    const TYPEDESC& pointee = *func->lprgelemdescParam[0].tdesc.lptdesc;
    ASSERT_EQ(pointee.vt, VT_USERDEFINED);
    EXPECT_EQ(func->lprgelemdescParam[0].paramdesc.wParamFlags, PARAMFLAG_FOUT | PARAMFLAG_FRETVAL);
    ASSERT_EQ(pm->GetRefTypeInfo(pointee.hreftype, state.GetAddressOf()), S_OK);
    pm->ReleaseFuncDesc(func);
    BStr stateName, libName, help;
    state->GetDocumentation(MEMBERID_NIL, stateName.Out(), nullptr, nullptr, nullptr);
    EXPECT_EQ(stateName.Utf8(), "PM_STATE");
    ASSERT_EQ(library_->GetDocumentation(-1, libName.Out(), help.Out(), nullptr, nullptr), S_OK);
    EXPECT_EQ(libName.Utf8(), "NqPortManagerLib");
    EXPECT_EQ(help.Utf8(), "NqPortManager 1.0 Type Library");
    TLIBATTR* attr = nullptr;
    ASSERT_EQ(library_->GetLibAttr(&attr), S_OK);
    EXPECT_EQ(attr->guid, LIBID_NqPortManagerLib);
    EXPECT_EQ(attr->wMajorVerNum * 100 + attr->wMinorVerNum, 100);
    EXPECT_EQ(attr->lcid, LOCALE_NEUTRAL);
    library_->ReleaseTLibAttr(attr);

    ComPtr<ITypeInfo> coclass;
    ASSERT_EQ(library_->GetTypeInfoOfGuid(CLSID_AdvancedPortManager, coclass.GetAddressOf()), S_OK);
    INT flags = 0;
    ASSERT_EQ(coclass->GetImplTypeFlags(2, &flags), S_OK);
    EXPECT_EQ(flags, IMPLTYPEFLAG_FDEFAULT | IMPLTYPEFLAG_FSOURCE);
    EXPECT_EQ(library_->GetTypeInfoOfGuid(GUID_NULL, coclass.GetAddressOf()),
              TYPE_E_ELEMENTNOTFOUND);
    VARDESC* var = nullptr;
    EXPECT_EQ(pm->GetFuncDesc(22, &func), TYPE_E_ELEMENTNOTFOUND);
    EXPECT_EQ(pm->GetVarDesc(0, &var), TYPE_E_ELEMENTNOTFOUND);
    EXPECT_EQ(pm->GetTypeAttr(nullptr), E_INVALIDARG);
    EXPECT_EQ(state->Invoke(pm.Get(), 0, DISPATCH_METHOD, nullptr, nullptr, nullptr, nullptr),
              E_INVALIDARG);  // an enumeration has nothing to call
    ITypeLib* other = nullptr;
    EXPECT_EQ(LoadRegTypeLib(LIBID_NqPortManagerLib, 2, 0, 0, &other), TYPE_E_LIBNOTREGISTERED);
    EXPECT_EQ(LoadRegTypeLib(GUID_NULL, 1, 0, 0, &other), TYPE_E_LIBNOTREGISTERED);
    EXPECT_EQ(LoadRegTypeLib(LIBID_NqPortManagerLib, 1, 0, 0xFFFFFFFF, &other),
              TYPE_E_LIBNOTREGISTERED);
    EXPECT_EQ(other, nullptr);
}

}  // namespace
