// Files, as far as the logger needs them.
#pragma once

#include <cstdio>
#include <string>

namespace platform {

inline constexpr char kPathSeparator = '/';

// Opens for appending in text mode, creating the file; null on failure. Not inherited by
// child processes.
std::FILE* OpenAppend(const std::string& path);

}  // namespace platform
