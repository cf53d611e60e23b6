// The module's entry points: the class table and its factories, the lock count behind
// DllCanUnloadNow, and registration.
#include <atomic>

#include <nqportmanager/NqPortManager.h>

#include "NqPortManager/Registration.h"
#include "NqPortManager/Registry.h"
#if defined(_WIN32)
#include "platform/typeinfo.h"
#else
#include "automation/NqPortManagerLib.h"
#endif
#include "foundation/Logger.h"
#include "platform/module.h"
#include "platform/modulelock.h"
#include "portmanager/AdvancedPortManager.h"
#include "sipproxy/LocalSipProxy.h"

namespace {

using Creator = HRESULT (*)(IUnknown* outer, REFIID riid, void** ppv);

// The type library that IDispatch is served from: oleaut32's on Windows, the module's own
// description elsewhere.
ITypeLib* TypeLibrary() {
#if defined(_WIN32)
    return platform::ModuleTypeLibrary(LIBID_NqPortManagerLib);
#else
    return automation::NqPortManagerTypeLib();
#endif
}

HRESULT CreatePortManager(IUnknown* outer, REFIID riid, void** ppv) {
    portmanager::PortManagerServices services = portmanager::PortManagerServices::Default();
    services.typeLibrary = TypeLibrary();
    return portmanager::CAdvancedPortManager::CreateInstance(outer, riid, ppv, std::move(services));
}

HRESULT CreateSipProxy(IUnknown* outer, REFIID riid, void** ppv) {
    if (outer != nullptr) {
        return CLASS_E_NOAGGREGATION;
    }
    return sipproxy::CLocalSipProxy::CreateInstance(riid, ppv, TypeLibrary());
}

// One per creatable class, for the module's lifetime. A reference held by a client locks the
// module as a live object would, and so does LockServer.
class ClassFactory final : public IClassFactory {
  public:
    explicit ClassFactory(Creator create) : m_create(create) {}

    HRESULT QueryInterface(REFIID riid, void** ppv) override {
        if (ppv == nullptr) {
            return E_POINTER;
        }
        if (riid != IID_IUnknown && riid != IID_IClassFactory) {
            *ppv = nullptr;
            return E_NOINTERFACE;
        }
        *ppv = static_cast<IClassFactory*>(this);
        AddRef();
        return S_OK;
    }
    ULONG AddRef() override {
        const ULONG refs = ++m_refs;
        if (refs == 1) {
            platform::LockModule();
        }
        return refs;
    }
    ULONG Release() override {
        const ULONG refs = --m_refs;
        if (refs == 0) {
            platform::UnlockModule();
        }
        return refs;
    }
    HRESULT CreateInstance(IUnknown* outer, REFIID riid, void** ppv) override {
        if (ppv == nullptr) {
            return E_POINTER;
        }
        *ppv = nullptr;
        return m_create(outer, riid, ppv);
    }
    HRESULT LockServer(INT lock) override {
        if (lock != 0) {
            platform::LockModule();
        } else {
            platform::UnlockModule();
        }
        return S_OK;
    }

  private:
    Creator m_create;
    std::atomic<ULONG> m_refs{0};
};

struct ClassEntry {
    registry::RegisteredClass registered;
    ClassFactory* factory;
};

ClassFactory g_portManagerFactory(CreatePortManager);
ClassFactory g_sipProxyFactory(CreateSipProxy);

// The creatable classes, in the order of registration.
const ClassEntry kClasses[] = {
    {{&CLSID_AdvancedPortManager, "AdvancedPortManager"}, &g_portManagerFactory},
    {{&CLSID_LocalSipProxy, "LocalSipProxy"}, &g_sipProxyFactory},
};

HRESULT UpdateRegistration(bool registering, const char* function) {
    std::vector<registry::RegisteredClass> classes;
    for (const ClassEntry& c : kClasses) {
        classes.push_back(c.registered);
    }
    const std::string module = platform::ModuleFilePath(reinterpret_cast<const void*>(&kClasses));
    std::string error;
    const HRESULT hr = registry::UpdateRegistration(registering, classes, module,
                                                    registry::DefaultRegistryPath(), error);
    if (FAILED(hr)) {
        NQ_LOG(function, foundation::kLogError, "0x%08x - %s", static_cast<unsigned>(hr),
               error.c_str());
    }
    return hr;
}

}  // namespace

extern "C" {

NQ_MODULE_EXPORT HRESULT DllGetClassObject(REFCLSID rclsid, REFIID riid, void** ppv) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    *ppv = nullptr;
    for (const ClassEntry& c : kClasses) {
        if (*c.registered.clsid == rclsid) {
            return c.factory->QueryInterface(riid, ppv);
        }
    }
    return CLASS_E_CLASSNOTAVAILABLE;
}

NQ_MODULE_EXPORT HRESULT DllCanUnloadNow() {
    return platform::ModuleLockCount() == 0 ? S_OK : S_FALSE;
}

NQ_MODULE_EXPORT HRESULT DllRegisterServer() {
    return UpdateRegistration(true, "DllRegisterServer");
}

NQ_MODULE_EXPORT HRESULT DllUnregisterServer() {
    return UpdateRegistration(false, "DllUnregisterServer");
}

}  // extern "C"
