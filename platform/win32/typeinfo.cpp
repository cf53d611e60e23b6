#include "platform/typeinfo.h"

#include <windows.h>

#include <map>
#include <mutex>
#include <string>

#include "platform/module.h"
#include "platform/win32/handle.h"

namespace platform {

namespace {

ITypeLib* LoadLibraryOf(REFGUID libid) {
    ITypeLib* lib = nullptr;
    if (SUCCEEDED(LoadRegTypeLib(libid, 1, 0, 0, &lib)) && lib != nullptr) {
        return lib;
    }
    const std::string file = ModuleFilePath(reinterpret_cast<const void*>(&LoadLibraryOf));
    if (file.empty() || FAILED(LoadTypeLibEx(Wide(file).c_str(), REGKIND_NONE, &lib)) ||
        lib == nullptr) {
        return nullptr;
    }
    return lib;
}

// Loaded once per library, held until the module unloads; a failure is remembered too.
struct LibraryCache {
    std::mutex mutex;
    std::map<std::string, ITypeLib*> libraries;
    ~LibraryCache() {
        for (auto& entry : libraries) {
            if (entry.second != nullptr) {
                entry.second->Release();
            }
        }
    }
} g_cache;

}  // namespace

ITypeLib* ModuleTypeLibrary(REFGUID libid) {
    const std::string key = GuidToString(libid);
    std::lock_guard<std::mutex> lock(g_cache.mutex);
    auto found = g_cache.libraries.find(key);
    if (found == g_cache.libraries.end()) {
        found = g_cache.libraries.emplace(key, LoadLibraryOf(libid)).first;
    }
    return found->second;
}

}  // namespace platform
