// The system's cryptographic random generator, for values an off-path host must not guess.
#pragma once

#include <cstddef>

namespace platform {

// Fills [buffer, buffer+size) with cryptographically strong bytes; waits only until the system's
// generator is first seeded. False (buffer contents unspecified) when the system refuses.
bool RandomBytes(void* buffer, size_t size);

}  // namespace platform
