#include "platform/console.h"

#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <unistd.h>

namespace platform {

bool IsStderrTerminal() {
    return isatty(STDERR_FILENO) == 1;
}

int InterruptDescriptor() {
    static const int fd = [] {
        sigset_t set;
        sigemptyset(&set);
        sigaddset(&set, SIGINT);
        sigaddset(&set, SIGTERM);
        // Blocked in every thread started later, so the signal stays pending for the descriptor.
        if (pthread_sigmask(SIG_BLOCK, &set, nullptr) != 0) {
            return -1;
        }
        return signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK);
    }();
    return fd;
}

bool InterruptRequested() {
    const int fd = InterruptDescriptor();
    if (fd < 0) {
        return false;
    }
    pollfd p{fd, POLLIN, 0};
    return poll(&p, 1, 0) == 1;
}

}  // namespace platform
