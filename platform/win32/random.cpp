#include "platform/random.h"

#include <windows.h>

#include <bcrypt.h>

#include <cstdint>

namespace platform {

bool RandomBytes(void* buffer, size_t size) {
    auto* p = static_cast<uint8_t*>(buffer);
    while (size > 0) {
        const ULONG chunk = size > 0x10000000 ? 0x10000000 : static_cast<ULONG>(size);
        if (!BCRYPT_SUCCESS(BCryptGenRandom(nullptr, p, chunk, BCRYPT_USE_SYSTEM_PREFERRED_RNG))) {
            return false;
        }
        p += chunk;
        size -= chunk;
    }
    return true;
}

}  // namespace platform
