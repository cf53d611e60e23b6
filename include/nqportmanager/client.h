// Creating the module's objects the way CoCreateInstance does on Windows: the class's
// InprocServer32 from the registry (or a module path the caller gives), the module loaded, its
// DllGetClassObject asked for the class factory, and the factory's CreateInstance. It lives in
// libNqPortManagerClient.so (pkg-config nqportmanager-client, CMake NqPortManager::Client). A
// client that links libNqPortManager.so directly can call DllGetClassObject itself instead.
#pragma once

#include <string>

#include <nqportmanager/NqPortManager.h>

namespace nqportmanager {

// A loaded module and its entry points. Copies share the module, which stays loaded: unload it
// with Unload once CanUnloadNow answers S_OK.
class Module {
  public:
    // The module file itself.
    static HRESULT Load(const std::string& path, Module& module, std::string* error = nullptr);
    // The module registered as the class's InprocServer32 in the registry file (empty: the
    // default one), or fallbackPath when the class is not registered there or that file cannot
    // be loaded. REGDB_E_CLASSNOTREG when neither gives a module.
    static HRESULT LoadForClass(REFCLSID clsid, const std::string& fallbackPath, Module& module,
                                std::string* error = nullptr,
                                const std::string& registryPath = std::string());

    HRESULT CreateInstance(REFCLSID clsid, IUnknown* outer, REFIID riid, void** ppv) const;
    HRESULT CanUnloadNow() const;
    bool Unload();
    bool IsLoaded() const { return m_handle != nullptr; }
    const std::string& Path() const { return m_path; }

    // One of the module's exported functions (its C API: SysAllocString, SysFreeString, ...),
    // for a client that loads the module instead of linking it: what the module allocates must
    // be freed with the module's functions. Null when the module has no such name.
    void* Symbol(const char* name) const;

    // The module's own message loop of the calling thread (see messageloop.h): the queue its
    // objects post to.
    int MessageQueueDescriptor() const;
    int PumpPendingMessages() const;
    int RunMessageLoopUntil(int (*done)(void* context), void* context, int timeoutMs) const;
    // Where the module's debugger output goes (see messageloop.h).
    void SetDebugOutputSink(void (*sink)(const char* line, size_t length, void* context),
                            void* context) const;

  private:
    void* m_handle = nullptr;
    std::string m_path;
    HRESULT (*m_getClassObject)(REFCLSID, REFIID, void**) = nullptr;
    HRESULT (*m_canUnloadNow)() = nullptr;
    int (*m_queueDescriptor)() = nullptr;
    int (*m_pump)() = nullptr;
    int (*m_runUntil)(int (*)(void*), void*, int) = nullptr;
    void (*m_setDebugOutput)(void (*)(const char*, size_t, void*), void*) = nullptr;
};

// The class id registered under a ProgID ("NqPortManager.AdvancedPortManager", with or without
// its version), from the registry file (empty: the default one). REGDB_E_CLASSNOTREG when it is
// not there.
HRESULT CLSIDFromProgID(const std::string& progId, CLSID& clsid,
                        const std::string& registryPath = std::string());

}  // namespace nqportmanager
