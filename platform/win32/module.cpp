#include "platform/module.h"

#include <windows.h>

#include "platform/win32/handle.h"

namespace platform {

std::string ModuleFilePath(const void* address) {
    HMODULE module = nullptr;
    if (!GetModuleHandleExW(
            GET_MODULE_HANDLE_EX_FLAG_FROM_ADDRESS | GET_MODULE_HANDLE_EX_FLAG_UNCHANGED_REFCOUNT,
            static_cast<LPCWSTR>(address), &module)) {
        return {};
    }
    std::wstring path(MAX_PATH, L'\0');
    for (;;) {
        const DWORD n = GetModuleFileNameW(module, path.data(), static_cast<DWORD>(path.size()));
        if (n == 0) {
            return {};
        }
        if (n < path.size()) {
            path.resize(n);
            return Utf8(path);
        }
        if (path.size() >= 32768) {
            return {};
        }
        path.resize(path.size() * 2);
    }
}

void* LoadModule(const std::string& path, std::string& error) {
    HMODULE module = LoadLibraryExW(Wide(path).c_str(), nullptr, LOAD_WITH_ALTERED_SEARCH_PATH);
    if (module == nullptr) {
        error = "cannot load " + path + ": " + SystemErrorText(GetLastError());
    }
    return reinterpret_cast<void*>(module);
}

void* ModuleSymbol(void* module, const char* name) {
    return module != nullptr
               ? reinterpret_cast<void*>(GetProcAddress(static_cast<HMODULE>(module), name))
               : nullptr;
}

bool UnloadModule(void* module) {
    return module != nullptr && FreeLibrary(static_cast<HMODULE>(module)) != FALSE;
}

}  // namespace platform
