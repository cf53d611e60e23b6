#include "platform/module.h"

#include <dlfcn.h>
#include <limits.h>
#include <stdlib.h>

namespace platform {

std::string ModuleFilePath(const void* address) {
    Dl_info info{};
    if (dladdr(address, &info) == 0 || info.dli_fname == nullptr) {
        return {};
    }
    // The loader reports the name it was given; registration needs one that works from anywhere.
    char resolved[PATH_MAX];
    return realpath(info.dli_fname, resolved) != nullptr ? resolved : info.dli_fname;
}

}  // namespace platform

namespace platform {

void* LoadModule(const std::string& path, std::string& error) {
    void* module = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (module == nullptr) {
        const char* why = dlerror();
        error = why != nullptr ? why : "cannot load " + path;
    }
    return module;
}

void* ModuleSymbol(void* module, const char* name) {
    return module != nullptr ? dlsym(module, name) : nullptr;
}

bool UnloadModule(void* module) {
    return module != nullptr && dlclose(module) == 0;
}

}  // namespace platform
