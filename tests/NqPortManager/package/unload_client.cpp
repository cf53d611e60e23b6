// A client that loads the module at run time instead of linking it: the class found by ProgID in
// the registry, both classes created, a discovery run against the STUN server, everything
// released, and the module unloaded once it answers S_OK, leaving no thread and no descriptor.
//   unload_client STUN-SERVER
#include <dirent.h>
#include <dlfcn.h>

#include <cstdio>
#include <string>

#include <nqportmanager/client.h>

namespace {

int Entries(const char* folder) {
    DIR* dir = opendir(folder);
    int count = 0;
    while (dir != nullptr && readdir(dir) != nullptr) {
        ++count;
    }
    if (dir != nullptr) {
        closedir(dir);
    }
    return count;
}

int Fail(const std::string& why) {
    std::fprintf(stderr, "unload_client: %s\n", why.c_str());
    return 1;
}

int Completed(void* pm) {
    PM_STATE state{};
    static_cast<IAdvancedPortManager*>(pm)->get_State(&state);
    return state == PMS_COMPLETED ? 1 : 0;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        return Fail("usage: unload_client STUN-SERVER");
    }
    const int threads = Entries("/proc/self/task");
    const int descriptors = Entries("/proc/self/fd");
    std::string path;
    {
        CLSID clsid{};
        nqportmanager::Module module;
        std::string error;
        if (FAILED(nqportmanager::CLSIDFromProgID("NqPortManager.AdvancedPortManager", clsid)) ||
            FAILED(nqportmanager::Module::LoadForClass(clsid, "", module, &error))) {
            return Fail("the registered class does not load: " + error);
        }
        path = module.Path();
        using Alloc = BSTR (*)(const OLECHAR*);
        using Free = void (*)(BSTR);
        auto alloc = reinterpret_cast<Alloc>(module.Symbol("SysAllocString"));
        auto free = reinterpret_cast<Free>(module.Symbol("SysFreeString"));
        if (alloc == nullptr || free == nullptr) {
            return Fail("the module lacks its BSTR functions");
        }

        ComPtr<IAdvancedPortManager> pm;
        ComPtr<IUnknown> proxy;
        if (FAILED(module.CreateInstance(clsid, nullptr, IID_IAdvancedPortManager,
                                         pm.GetVoidAddressOf())) ||
            FAILED(module.CreateInstance(CLSID_LocalSipProxy, nullptr, IID_IUnknown,
                                         proxy.GetVoidAddressOf()))) {
            return Fail("the classes cannot be created");
        }
        const std::string server = argv[1];
        const std::u16string wide(server.begin(), server.end());
        BSTR stun = alloc(wide.c_str());
        BSTR sip = alloc(u"sip.example.net");
        const HRESULT hr = pm->InitializeEx(stun, 5004, 16, sip, sip, VARIANT_TRUE, VARIANT_FALSE);
        free(stun);
        free(sip);
        if (FAILED(hr) || module.RunMessageLoopUntil(Completed, pm.Get(), 60000) == 0) {
            return Fail("the discovery did not complete");
        }
        pm->Shutdown();
        pm.Reset();
        proxy.Reset();
        if (module.CanUnloadNow() != S_OK || !module.Unload()) {
            return Fail("the module does not unload after the last release");
        }
    }
    if (dlopen(path.c_str(), RTLD_NOW | RTLD_NOLOAD) != nullptr) {
        return Fail(path + " is still mapped after dlclose");
    }
    if (Entries("/proc/self/task") != threads || Entries("/proc/self/fd") != descriptors) {
        return Fail("threads or descriptors are left behind");
    }
    std::printf("unloaded %s\n", path.c_str());
    return 0;
}
