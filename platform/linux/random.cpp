#include "platform/random.h"

#include <sys/random.h>

#include <cerrno>
#include <cstdint>

namespace platform {

bool RandomBytes(void* buffer, size_t size) {
    auto* p = static_cast<uint8_t*>(buffer);
    while (size > 0) {
        // Requests above 256 bytes may come back short, and a signal may interrupt the wait.
        const ssize_t n = getrandom(p, size, 0);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        p += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

}  // namespace platform
