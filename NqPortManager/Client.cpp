// The client helper of client.h: registry look-up, loading and the entry points of a module.
#include <nqportmanager/client.h>

#include "NqPortManager/Registry.h"
#include "platform/module.h"

namespace nqportmanager {

namespace {

template <typename Function>
void Find(void* handle, const char* name, Function& function) {
    function = reinterpret_cast<Function>(platform::ModuleSymbol(handle, name));
}

bool ReadRegistry(const std::string& registryPath, registry::RegistryKey& root,
                  std::string& error) {
    const std::string path = registryPath.empty() ? registry::DefaultRegistryPath() : registryPath;
    return !path.empty() && registry::ReadRegistryFile(path, root, error);
}

void Report(std::string* error, const std::string& text) {
    if (error != nullptr) {
        *error = text;
    }
}

}  // namespace

HRESULT Module::Load(const std::string& path, Module& module, std::string* error) {
    std::string why;
    void* handle = platform::LoadModule(path, why);
    if (handle == nullptr) {
        Report(error, why);
        return E_FAIL;
    }
    Module loaded;
    loaded.m_handle = handle;
    loaded.m_path = path;
    Find(handle, "DllGetClassObject", loaded.m_getClassObject);
    Find(handle, "DllCanUnloadNow", loaded.m_canUnloadNow);
    Find(handle, "NqMessageQueueDescriptor", loaded.m_queueDescriptor);
    Find(handle, "NqPumpPendingMessages", loaded.m_pump);
    Find(handle, "NqRunMessageLoopUntil", loaded.m_runUntil);
    Find(handle, "NqSetDebugOutputSink", loaded.m_setDebugOutput);
    if (loaded.m_getClassObject == nullptr || loaded.m_canUnloadNow == nullptr ||
        loaded.m_queueDescriptor == nullptr || loaded.m_pump == nullptr ||
        loaded.m_runUntil == nullptr || loaded.m_setDebugOutput == nullptr) {
        platform::UnloadModule(handle);
        Report(error, path + " is not an NqPortManager module");
        return E_FAIL;
    }
    module = loaded;
    return S_OK;
}

HRESULT Module::LoadForClass(REFCLSID clsid, const std::string& fallbackPath, Module& module,
                             std::string* error, const std::string& registryPath) {
    registry::RegistryKey root;
    std::string why;
    std::string registered;
    if (ReadRegistry(registryPath, root, why)) {
        const registry::RegistryKey* server =
            root.FindPath("CLSID\\" + GuidToString(clsid) + "\\InprocServer32");
        if (server != nullptr && server->values.count("") != 0) {
            registered = server->values.at("").text;
        }
    }
    if (!registered.empty() && SUCCEEDED(Load(registered, module, &why))) {
        return S_OK;
    }
    if (!fallbackPath.empty()) {
        return Load(fallbackPath, module, error);
    }
    Report(error,
           registered.empty() ? "the class " + GuidToString(clsid) + " is not registered" : why);
    return REGDB_E_CLASSNOTREG;
}

HRESULT Module::CreateInstance(REFCLSID clsid, IUnknown* outer, REFIID riid, void** ppv) const {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    *ppv = nullptr;
    if (m_getClassObject == nullptr) {
        return E_UNEXPECTED;
    }
    ComPtr<IClassFactory> factory;
    const HRESULT hr = m_getClassObject(clsid, IID_IClassFactory, factory.GetVoidAddressOf());
    return FAILED(hr) ? hr : factory->CreateInstance(outer, riid, ppv);
}

HRESULT Module::CanUnloadNow() const {
    return m_canUnloadNow != nullptr ? m_canUnloadNow() : S_OK;
}

bool Module::Unload() {
    if (m_handle == nullptr || CanUnloadNow() != S_OK) {
        return false;
    }
    const bool unloaded = platform::UnloadModule(m_handle);
    *this = Module();
    return unloaded;
}

void* Module::Symbol(const char* name) const {
    return platform::ModuleSymbol(m_handle, name);
}

int Module::MessageQueueDescriptor() const {
    return m_queueDescriptor != nullptr ? m_queueDescriptor() : -1;
}

int Module::PumpPendingMessages() const {
    return m_pump != nullptr ? m_pump() : 0;
}

int Module::RunMessageLoopUntil(int (*done)(void* context), void* context, int timeoutMs) const {
    return m_runUntil != nullptr ? m_runUntil(done, context, timeoutMs) : 0;
}

void Module::SetDebugOutputSink(void (*sink)(const char* line, size_t length, void* context),
                                void* context) const {
    if (m_setDebugOutput != nullptr) {
        m_setDebugOutput(sink, context);
    }
}

HRESULT CLSIDFromProgID(const std::string& progId, CLSID& clsid, const std::string& registryPath) {
    registry::RegistryKey root;
    std::string why;
    if (!ReadRegistry(registryPath, root, why)) {
        return REGDB_E_CLASSNOTREG;
    }
    const registry::RegistryKey* key = root.FindPath(progId + "\\CLSID");
    if (progId.find('\\') != std::string::npos || key == nullptr || key->values.count("") == 0 ||
        !GuidFromString(key->values.at("").text, &clsid)) {
        return REGDB_E_CLASSNOTREG;
    }
    return S_OK;
}

}  // namespace nqportmanager
