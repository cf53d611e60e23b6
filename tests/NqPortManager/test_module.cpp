// libNqPortManager.so as a client loads it: its exports, class table, factories, lock count,
// aggregation and registration, through dlopen and the entry points alone.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>
#include <string>

#include <nqportmanager/NqPortManager.h>
#include <nqportmanager/client.h>

#include "NqPortManager/Registry.h"
#include "tests/support/os/command.h"

namespace {

const std::string kModule = std::string(NQPM_BINARY_DIR) + "/lib/libNqPortManager.so";

// The module, loaded afresh for each test and its entry points looked up by name.
class Module : public ::testing::Test {
  protected:
    void SetUp() override {
        handle_ = dlopen(kModule.c_str(), RTLD_NOW | RTLD_LOCAL);
        ASSERT_NE(handle_, nullptr) << dlerror();
        getClassObject_ =
            reinterpret_cast<decltype(getClassObject_)>(dlsym(handle_, "DllGetClassObject"));
        canUnloadNow_ =
            reinterpret_cast<decltype(canUnloadNow_)>(dlsym(handle_, "DllCanUnloadNow"));
        register_ = reinterpret_cast<decltype(register_)>(dlsym(handle_, "DllRegisterServer"));
        unregister_ =
            reinterpret_cast<decltype(unregister_)>(dlsym(handle_, "DllUnregisterServer"));
        ASSERT_TRUE(getClassObject_ && canUnloadNow_ && register_ && unregister_);
    }
    void TearDown() override {
        if (handle_ != nullptr) {
            EXPECT_EQ(canUnloadNow_(), S_OK) << "a test left an object of the module alive";
            EXPECT_EQ(dlclose(handle_), 0);
        }
    }
    ComPtr<IClassFactory> Factory() {
        ComPtr<IClassFactory> factory;
        EXPECT_EQ(getClassObject_(CLSID_AdvancedPortManager, IID_IClassFactory,
                                  factory.GetVoidAddressOf()),
                  S_OK);
        return factory;
    }

    void* handle_ = nullptr;
    HRESULT (*getClassObject_)(REFCLSID, REFIID, void**) = nullptr;
    HRESULT (*canUnloadNow_)() = nullptr;
    HRESULT (*register_)() = nullptr;
    HRESULT (*unregister_)() = nullptr;
};

TEST_F(Module, ExportsExactlyItsEntryPoints) {
    std::string out;
    ASSERT_EQ(platform::testing::RunCommand({"nm", "-D", "--defined-only", kModule}, &out), 0);
    std::set<std::string> names;
    std::istringstream lines(out);
    for (std::string address, kind, name; lines >> address >> kind >> name;) {
        names.insert(name);
    }
    // The entry points and the small C API a client needs beside them, nothing else.
    const std::set<std::string> expected = {
        "DllGetClassObject",     "DllCanUnloadNow",       "DllRegisterServer",
        "DllUnregisterServer",   "SysAllocString",        "SysAllocStringLen",
        "SysAllocStringByteLen", "SysReAllocString",      "SysReAllocStringLen",
        "SysFreeString",         "SysStringLen",          "SysStringByteLen",
        "VariantInit",           "VariantClear",          "VariantCopy",
        "VariantChangeType",     "LoadRegTypeLib",        "SafeArrayCreate",
        "SafeArrayCreateVector", "SafeArrayDestroy",      "SafeArrayGetDim",
        "SafeArrayGetElemsize",  "SafeArrayGetLBound",    "SafeArrayGetUBound",
        "SafeArrayGetElement",   "SafeArrayPutElement",   "SafeArrayGetVartype",
        "SafeArrayLock",         "SafeArrayUnlock",       "SafeArrayAccessData",
        "SafeArrayUnaccessData", "SafeArrayCopy",         "CreateErrorInfo",
        "SetErrorInfo",          "GetErrorInfo",          "NqMessageQueueDescriptor",
        "NqPumpPendingMessages", "NqRunMessageLoopUntil", "NqRunMessageLoop",
        "NqQuitMessageLoop",     "NqSetDebugOutputSink"};
    EXPECT_EQ(names, expected);
}

TEST_F(Module, ClassTableFactoriesAndTheLockCount) {
    void* none = &none;
    for (const CLSID& clsid :
         {CLSID_PortManagerUpdateEvent, CLSID_NetworkDiagnosticEvent, GUID_NULL}) {
        EXPECT_EQ(getClassObject_(clsid, IID_IClassFactory, &none), CLASS_E_CLASSNOTAVAILABLE);
        EXPECT_EQ(none, nullptr);
    }
    EXPECT_EQ(getClassObject_(CLSID_AdvancedPortManager, IID_IClassFactory, nullptr), E_POINTER);
    EXPECT_EQ(getClassObject_(CLSID_AdvancedPortManager, IID_IDispatch, &none), E_NOINTERFACE);
    EXPECT_EQ(canUnloadNow_(), S_OK);

    ComPtr<IClassFactory> factory = Factory();
    ASSERT_TRUE(factory);
    EXPECT_EQ(canUnloadNow_(), S_FALSE) << "a held factory";
    ComPtr<IAdvancedPortManager> pm;
    ASSERT_EQ(factory->CreateInstance(nullptr, IID_IAdvancedPortManager, pm.GetVoidAddressOf()),
              S_OK);
    EXPECT_EQ(factory->CreateInstance(nullptr, IID_IAdvancedPortManager, nullptr), E_POINTER);
    factory.Reset();
    EXPECT_EQ(canUnloadNow_(), S_FALSE) << "a live port manager";
    ComPtr<IConnectionPointContainer> container;
    ASSERT_EQ(pm->QueryInterface(IID_IConnectionPointContainer, container.GetVoidAddressOf()),
              S_OK);
    pm.Reset();
    EXPECT_EQ(canUnloadNow_(), S_FALSE) << "an interface of it";
    container.Reset();
    EXPECT_EQ(canUnloadNow_(), S_OK);

    // The proxy is created alone; it cannot be aggregated.
    ComPtr<IClassFactory> proxyFactory;
    ASSERT_EQ(
        getClassObject_(CLSID_LocalSipProxy, IID_IClassFactory, proxyFactory.GetVoidAddressOf()),
        S_OK);
    ComPtr<ILocalSipProxy> proxy;
    ASSERT_EQ(proxyFactory->CreateInstance(nullptr, IID_ILocalSipProxy, proxy.GetVoidAddressOf()),
              S_OK);
    IUnknown* aggregate = nullptr;
    EXPECT_EQ(proxyFactory->CreateInstance(proxy.Get(), IID_IUnknown,
                                           reinterpret_cast<void**>(&aggregate)),
              CLASS_E_NOAGGREGATION);
    auto status = proxy.As<ILocalSipProxyStatus>();
    ASSERT_TRUE(status);
    uint64_t counts[3] = {9, 9, 9};
    EXPECT_EQ(status->GetRelayCounts(&counts[0], &counts[1], &counts[2]), S_OK);
    EXPECT_EQ(counts[0] + counts[1] + counts[2], 0u) << "nothing relayed before Start";
    EXPECT_EQ(status->GetRelayCounts(nullptr, &counts[1], &counts[2]), E_POINTER);
    proxyFactory.Reset();
    EXPECT_EQ(canUnloadNow_(), S_FALSE) << "a live proxy";
    proxy.Reset();
    EXPECT_EQ(canUnloadNow_(), S_FALSE) << "its status interface";
    status.Reset();
    EXPECT_EQ(canUnloadNow_(), S_OK);

    factory = Factory();
    ASSERT_EQ(factory->LockServer(1), S_OK);
    factory.Reset();
    EXPECT_EQ(canUnloadNow_(), S_FALSE) << "a server lock";
    Factory()->LockServer(0);
    EXPECT_EQ(canUnloadNow_(), S_OK);
}

// A controlling object that aggregates the port manager: it keeps the inner unknown, hands out
// the port manager's interfaces through it and counts the references they take.
class Outer final : public IUnknown {
  public:
    HRESULT QueryInterface(REFIID riid, void** ppv) override {
        if (riid == IID_IUnknown) {
            *ppv = static_cast<IUnknown*>(this);
            AddRef();
            return S_OK;
        }
        return inner->QueryInterface(riid, ppv);
    }
    ULONG AddRef() override { return ++refs; }
    ULONG Release() override {
        const ULONG left = --refs;
        if (left == 0) {
            inner.Reset();  // the aggregate ends with its outer object
        }
        return left;
    }
    ComPtr<IUnknown> inner;
    std::atomic<ULONG> refs{1};
};

TEST_F(Module, AggregatedPortManagerDelegatesToItsOuterAndEndsWithIt) {
    Outer outer;
    ComPtr<IClassFactory> factory = Factory();
    void* none = &none;
    EXPECT_EQ(factory->CreateInstance(&outer, IID_IAdvancedPortManager, &none),
              CLASS_E_NOAGGREGATION);
    EXPECT_EQ(none, nullptr);
    ASSERT_EQ(factory->CreateInstance(&outer, IID_IUnknown, outer.inner.GetVoidAddressOf()), S_OK);
    factory.Reset();

    IAdvancedPortManager* pm = nullptr;
    ASSERT_EQ(outer.QueryInterface(IID_IAdvancedPortManager, reinterpret_cast<void**>(&pm)), S_OK);
    EXPECT_EQ(outer.refs.load(), 2u) << "the inner's interface counts on the outer";
    IUnknown* identity = nullptr;
    ASSERT_EQ(pm->QueryInterface(IID_IUnknown, reinterpret_cast<void**>(&identity)), S_OK);
    EXPECT_EQ(identity, static_cast<IUnknown*>(&outer));
    identity->Release();
    PM_STATE state{};
    EXPECT_EQ(pm->get_State(&state), S_OK);
    pm->Release();
    EXPECT_EQ(outer.refs.load(), 1u);
    EXPECT_EQ(canUnloadNow_(), S_FALSE);
    outer.Release();
    EXPECT_EQ(canUnloadNow_(), S_OK);
}

TEST_F(Module, RegistrationRoundTripsInTheRegistryFileAndRefusesABrokenOne) {
    const std::filesystem::path dir =
        std::filesystem::path(::testing::TempDir()) / ("nqpm-module-" + std::to_string(getpid()));
    const std::string file = (dir / "registry.json").string();
    std::filesystem::remove_all(dir);
    ASSERT_EQ(setenv("NQPM_REGISTRY", file.c_str(), 1), 0);
    ASSERT_EQ(register_(), S_OK);
    registry::RegistryKey root;
    std::string error;
    ASSERT_TRUE(registry::ReadRegistryFile(file, root, error)) << error;
    const std::string clsid = "CLSID\\" + GuidToString(CLSID_AdvancedPortManager);
    const registry::RegistryKey* server = root.FindPath(clsid + "\\InprocServer32");
    ASSERT_NE(server, nullptr);
    EXPECT_EQ(server->values.at("").text, std::filesystem::canonical(kModule).string());
    EXPECT_EQ(server->values.at("ThreadingModel").text, "Apartment");
    EXPECT_EQ(root.FindPath("NqPortManager.AdvancedPortManager\\CurVer")->values.at("").text,
              "NqPortManager.AdvancedPortManager.1");
    EXPECT_EQ(root.FindPath(clsid + "\\TypeLib")->values.at("").text,
              GuidToString(LIBID_NqPortManagerLib));
    EXPECT_NE(root.FindPath("CLSID\\" + GuidToString(CLSID_LocalSipProxy) + "\\InprocServer32"),
              nullptr);
    EXPECT_EQ(root.FindPath("CLSID\\" + GuidToString(CLSID_PortManagerUpdateEvent)), nullptr)
        << "the event classes are not registered";
    ASSERT_EQ(register_(), S_OK) << "twice";

    // A client that knows only the ProgID finds, loads and creates the class.
    CLSID found{};
    ASSERT_EQ(nqportmanager::CLSIDFromProgID("NqPortManager.AdvancedPortManager", found), S_OK);
    EXPECT_EQ(found, CLSID_AdvancedPortManager);
    EXPECT_EQ(nqportmanager::CLSIDFromProgID("NqPortManager.Nothing", found), REGDB_E_CLASSNOTREG);
    nqportmanager::Module module;
    ASSERT_EQ(nqportmanager::Module::LoadForClass(found, "", module), S_OK);
    ComPtr<IAdvancedPortManager> pm;
    ASSERT_EQ(
        module.CreateInstance(found, nullptr, IID_IAdvancedPortManager, pm.GetVoidAddressOf()),
        S_OK);
    EXPECT_FALSE(module.Unload()) << "an object of it lives";
    pm.Reset();
    EXPECT_TRUE(module.Unload());

    ASSERT_EQ(unregister_(), S_OK);
    ASSERT_TRUE(registry::ReadRegistryFile(file, root, error)) << error;
    EXPECT_EQ(nqportmanager::Module::LoadForClass(CLSID_AdvancedPortManager, "", module),
              REGDB_E_CLASSNOTREG);
    EXPECT_EQ(nqportmanager::Module::LoadForClass(CLSID_AdvancedPortManager, kModule, module), S_OK)
        << "the fall-back";
    EXPECT_TRUE(module.Unload());
    for (const char* kept : {"AppID", "CLSID", "TypeLib"}) {
        ASSERT_NE(root.Find(kept), nullptr) << kept;
        EXPECT_TRUE(root.Find(kept)->subkeys.empty()) << kept;
    }
    EXPECT_EQ(root.subkeys.size(), 3u);

    { std::ofstream(file) << "{\"format\":"; }
    EXPECT_EQ(register_(), E_FAIL);
    std::ifstream in(file);
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}), "{\"format\":");
    unsetenv("NQPM_REGISTRY");
    std::filesystem::remove_all(dir);
}

}  // namespace
