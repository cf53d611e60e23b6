// The loaded module a piece of code belongs to.
#pragma once

#include "platform/system_names.h"

#include <string>

namespace platform {

// The full path of the executable or shared library that holds the address; empty when the
// loader does not know it.
std::string ModuleFilePath(const void* address);

}  // namespace platform

namespace platform {

// A shared library loaded for good: it stays loaded until UnloadModule, which the owner calls
// only once the module says it may go. Null with the loader's reason in error.
void* LoadModule(const std::string& path, std::string& error);
void* ModuleSymbol(void* module, const char* name);
bool UnloadModule(void* module);

}  // namespace platform
