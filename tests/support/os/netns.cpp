#include "tests/support/os/netns.h"

#include <fcntl.h>
#include <sched.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <sstream>

#include "tests/support/os/command.h"

namespace platform::testing {

bool IsRoot() {
    return geteuid() == 0;
}

namespace {
// Runs a short command with its output dropped; its exit status.
int Quietly(const std::vector<std::string>& argv) {
    std::string ignored;
    return RunCommand(argv, &ignored);
}
}  // namespace

namespace {
std::atomic<int> g_counter{0};
}

ScopedNetns::ScopedNetns(const std::string& prefix)
    : name_(prefix + "-" + std::to_string(getpid()) + "-" + std::to_string(g_counter++)) {
    if (Quietly({"ip", "netns", "add", name_}) != 0) {
        return;
    }
    valid_ = true;
    // Gateways through other interfaces need the loopback up.
    if (!Ip("link set lo up")) {
        valid_ = false;
    }
}

ScopedNetns::~ScopedNetns() {
    Leave();
    // Also after a failed creation: a half-made namespace must not stay behind.
    Quietly({"ip", "netns", "delete", name_});
}

bool ScopedNetns::Ip(const std::string& arguments) const {
    std::vector<std::string> argv{"ip", "-n", name_};
    std::istringstream words(arguments);
    std::string word;
    while (words >> word) {
        argv.push_back(word);
    }
    return Quietly(argv) == 0;
}

bool ScopedNetns::Enter() {
    if (!valid_ || originalFd_ >= 0) {
        return false;
    }
    const int original = open("/proc/thread-self/ns/net", O_RDONLY | O_CLOEXEC);
    if (original < 0) {
        return false;
    }
    const int target = open(("/run/netns/" + name_).c_str(), O_RDONLY | O_CLOEXEC);
    if (target < 0) {
        close(original);
        return false;
    }
    const bool entered = setns(target, CLONE_NEWNET) == 0;
    close(target);
    if (!entered) {
        close(original);
        return false;
    }
    originalFd_ = original;
    return true;
}

void ScopedNetns::Leave() {
    if (originalFd_ < 0) {
        return;
    }
    if (setns(originalFd_, CLONE_NEWNET) != 0) {
        // A test thread stranded in a deleted namespace would mislead every later test.
        std::abort();
    }
    close(originalFd_);
    originalFd_ = -1;
}

}  // namespace platform::testing
