// Kernel handles travel through the platform interfaces as int descriptors: Windows keeps
// handle values within 32 bits (sign-extended), so the conversion loses nothing.
#pragma once

#include <windows.h>

#include <cstdint>
#include <string>
#include <string_view>

namespace platform {

inline HANDLE HandleOf(int descriptor) {
    return reinterpret_cast<HANDLE>(static_cast<intptr_t>(descriptor));
}
inline int DescriptorOf(HANDLE handle) {
    return handle == nullptr ? -1 : static_cast<int>(reinterpret_cast<intptr_t>(handle));
}

// UTF-8 to UTF-16 and back, for the W functions; malformed input is replaced, not refused.
std::wstring Wide(std::string_view utf8);
std::string Utf8(std::wstring_view wide);

// The system's text for an error code, without the trailing line break.
std::string SystemErrorText(DWORD error);

}  // namespace platform
