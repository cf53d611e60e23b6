#include "platform/typeinfo.h"

#include <windows.h>

#include <map>
#include <mutex>
#include <string>

#include "platform/module.h"
#include "platform/win32/handle.h"

namespace platform {

namespace {

// Loaded once per library and interface, held until the module unloads.
struct TypeInfoCache {
    std::mutex mutex;
    std::map<std::string, ITypeInfo*> infos;
    ~TypeInfoCache() {
        for (auto& entry : infos) {
            if (entry.second != nullptr) {
                entry.second->Release();
            }
        }
    }
} g_cache;

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

}  // namespace

ITypeInfo* DispatchTypeInfo(REFGUID libid, REFIID iid) {
    const std::string key = GuidToString(libid) + GuidToString(iid);
    std::lock_guard<std::mutex> lock(g_cache.mutex);
    auto found = g_cache.infos.find(key);
    if (found != g_cache.infos.end()) {
        return found->second;
    }
    ITypeInfo* info = nullptr;
    if (ITypeLib* lib = LoadLibraryOf(libid)) {
        if (FAILED(lib->GetTypeInfoOfGuid(iid, &info))) {
            info = nullptr;
        }
        lib->Release();
    }
    // A failure is remembered too: the library does not appear while the module runs.
    g_cache.infos.emplace(key, info);
    return info;
}

HRESULT DispatchGetTypeInfo(ITypeInfo* info, UINT index, ITypeInfo** out) {
    if (out != nullptr) {
        *out = nullptr;
    }
    if (info == nullptr) {
        return TYPE_E_ELEMENTNOTFOUND;
    }
    if (index != 0) {
        return DISP_E_BADINDEX;
    }
    if (out == nullptr) {
        return E_POINTER;
    }
    info->AddRef();
    *out = info;
    return S_OK;
}

HRESULT DispatchGetIDsOfNames(ITypeInfo* info, LPOLESTR* names, UINT count, DISPID* ids) {
    return info != nullptr ? DispGetIDsOfNames(info, names, count, ids) : DISP_E_UNKNOWNNAME;
}

HRESULT DispatchInvoke(void* object, ITypeInfo* info, DISPID member, WORD flags, DISPPARAMS* params,
                       VARIANT* result, EXCEPINFO* exception, UINT* argError) {
    return info != nullptr
               ? DispInvoke(object, info, member, flags, params, result, exception, argError)
               : DISP_E_MEMBERNOTFOUND;
}

}  // namespace platform
