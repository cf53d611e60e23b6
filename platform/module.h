// The loaded module a piece of code belongs to.
#pragma once

#include <string>

namespace platform {

// The full path of the executable or shared library that holds the address; empty when the
// loader does not know it.
std::string ModuleFilePath(const void* address);

}  // namespace platform
