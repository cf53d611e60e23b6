// NqPortManager.dll as a COM client loads it: its four entry points by name, its embedded type
// library and registry scripts, a class factory that creates the port manager, and the lock count
// behind DllCanUnloadNow.
#include <gtest/gtest.h>

#include <string>

#include <nqportmanager/NqPortManager.h>

namespace {

// The build tree's path as Wine sees it: drive Z: is the host's root.
std::wstring WinePath(const std::string& unixPath) {
    std::wstring path = L"Z:";
    for (const char c : unixPath) {
        path.push_back(c == '/' ? L'\\' : static_cast<wchar_t>(c));
    }
    return path;
}

using GetClassObjectFn = HRESULT(__stdcall*)(REFCLSID, REFIID, void**);
using CanUnloadNowFn = HRESULT(__stdcall*)();

class ModuleDll : public ::testing::Test {
  protected:
    void SetUp() override {
        module_ = LoadLibraryW(WinePath(NQ_DLL_PATH).c_str());
        ASSERT_NE(module_, nullptr) << GetLastError();
    }
    void TearDown() override {
        if (module_ != nullptr) {
            FreeLibrary(module_);
        }
    }
    template <typename F>
    F Entry(const char* name) {
        return reinterpret_cast<F>(reinterpret_cast<void*>(GetProcAddress(module_, name)));
    }
    // A registry script resource, bounded by its size: resources carry no terminator.
    std::string Script(int id) {
        HRSRC found = FindResourceW(module_, MAKEINTRESOURCEW(id), L"REGISTRY");
        EXPECT_NE(found, nullptr) << id;
        if (found == nullptr) {
            return {};
        }
        const auto* text = static_cast<const char*>(LockResource(LoadResource(module_, found)));
        return text != nullptr ? std::string(text, SizeofResource(module_, found)) : std::string();
    }
    HMODULE module_ = nullptr;
};

TEST_F(ModuleDll, ExportsTheFourEntryPointsByName) {
    for (const char* name :
         {"DllGetClassObject", "DllCanUnloadNow", "DllRegisterServer", "DllUnregisterServer"}) {
        EXPECT_NE(GetProcAddress(module_, name), nullptr) << name;
    }
}

TEST_F(ModuleDll, CarriesItsTypeLibraryAndRegistryScripts) {
    EXPECT_NE(FindResourceW(module_, MAKEINTRESOURCEW(1), L"TYPELIB"), nullptr);
    for (const int id : {101, 103, 104, 105, 106}) {
        const std::string script = Script(id);
        EXPECT_EQ(script.rfind("HKCR", 0), 0u) << id;
        EXPECT_EQ(script.find("%CLASS%"), std::string::npos) << id;
    }
    EXPECT_NE(Script(103).find(GuidToString(CLSID_AdvancedPortManager)), std::string::npos);
    EXPECT_NE(Script(105).find(GuidToString(CLSID_LocalSipProxy)), std::string::npos);
    // The library embedded in the module: what IDispatch falls back to when none is registered.
    ComPtr<ITypeLib> lib;
    ASSERT_EQ(LoadTypeLibEx(WinePath(NQ_DLL_PATH).c_str(), REGKIND_NONE, lib.GetAddressOf()), S_OK);
    TLIBATTR* attr = nullptr;
    ASSERT_EQ(lib->GetLibAttr(&attr), S_OK);
    EXPECT_EQ(GuidToString(attr->guid), GuidToString(LIBID_NqPortManagerLib));
    lib->ReleaseTLibAttr(attr);
}

TEST_F(ModuleDll, FactoryCreatesThePortManagerAndLocksTheModuleWhileItLives) {
    auto getClassObject = Entry<GetClassObjectFn>("DllGetClassObject");
    auto canUnloadNow = Entry<CanUnloadNowFn>("DllCanUnloadNow");
    ASSERT_TRUE(getClassObject && canUnloadNow);
    ComPtr<IClassFactory> factory;
    EXPECT_EQ(
        getClassObject(CLSID_NetworkDiagnosticEvent, IID_IClassFactory, factory.GetVoidAddressOf()),
        CLASS_E_CLASSNOTAVAILABLE);
    ASSERT_EQ(
        getClassObject(CLSID_AdvancedPortManager, IID_IClassFactory, factory.GetVoidAddressOf()),
        S_OK);
    ComPtr<IAdvancedPortManager> manager;
    ASSERT_EQ(
        factory->CreateInstance(nullptr, IID_IAdvancedPortManager, manager.GetVoidAddressOf()),
        S_OK);
    factory.Reset();
    EXPECT_EQ(canUnloadNow(), S_FALSE);
    PM_STATE state = PMS_COMPLETED;
    EXPECT_EQ(manager->get_State(&state), S_OK);
    EXPECT_EQ(state, PMS_UNINITIALIZED);
    manager.Reset();
    EXPECT_EQ(canUnloadNow(), S_OK);
}

// Late binding as a script would do it: oleaut32 answers from the module's type library (the
// embedded one here: nothing is registered in this prefix).
TEST_F(ModuleDll, DispatchIsServedFromTheTypeLibrary) {
    auto getClassObject = Entry<GetClassObjectFn>("DllGetClassObject");
    ComPtr<IClassFactory> factory;
    ASSERT_EQ(
        getClassObject(CLSID_AdvancedPortManager, IID_IClassFactory, factory.GetVoidAddressOf()),
        S_OK);
    ComPtr<IDispatch> dispatch;
    ASSERT_EQ(factory->CreateInstance(nullptr, IID_IDispatch, dispatch.GetVoidAddressOf()), S_OK);
    UINT count = 0;
    ASSERT_EQ(dispatch->GetTypeInfoCount(&count), S_OK);
    EXPECT_EQ(count, 1u);
    BStr name("NumberOfPorts");
    LPOLESTR names[] = {name.Get()};
    DISPID id = DISPID_UNKNOWN;
    ASSERT_EQ(dispatch->GetIDsOfNames(IID_NULL, names, 1, LOCALE_NEUTRAL, &id), S_OK);
    EXPECT_EQ(id, 6);
    DISPPARAMS none{};
    VARIANT result;
    VariantInit(&result);
    ASSERT_EQ(dispatch->Invoke(id, IID_NULL, LOCALE_NEUTRAL, DISPATCH_PROPERTYGET, &none, &result,
                               nullptr, nullptr),
              S_OK);
    EXPECT_EQ(result.vt, VT_I4);
    VariantClear(&result);
    // A method with an out argument through DispInvoke: ErrorCanBeDiagnosed(errorCode).
    VARIANT argument;
    VariantInit(&argument);
    argument.vt = VT_I4;
    argument.lVal = 0;
    DISPPARAMS one{&argument, nullptr, 1, 0};
    EXPECT_EQ(dispatch->Invoke(23, IID_NULL, LOCALE_NEUTRAL, DISPATCH_METHOD, &one, &result,
                               nullptr, nullptr),
              S_OK);
    EXPECT_EQ(result.vt, VT_BOOL);
    BStr unknown("NoSuchMember");
    names[0] = unknown.Get();
    EXPECT_EQ(dispatch->GetIDsOfNames(IID_NULL, names, 1, LOCALE_NEUTRAL, &id), DISP_E_UNKNOWNNAME);
}

}  // namespace
