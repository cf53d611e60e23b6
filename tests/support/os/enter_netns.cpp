#include "tests/support/os/enter_netns.h"

#include <fcntl.h>
#include <sched.h>
#include <unistd.h>

namespace platform::testing {

NamedNetnsEntry::NamedNetnsEntry(const std::string& name) {
    const int original = open("/proc/thread-self/ns/net", O_RDONLY | O_CLOEXEC);
    const int target = open(("/run/netns/" + name).c_str(), O_RDONLY | O_CLOEXEC);
    if (original >= 0 && target >= 0 && setns(target, CLONE_NEWNET) == 0) {
        original_ = original;
    } else if (original >= 0) {
        close(original);
    }
    if (target >= 0) {
        close(target);
    }
}

NamedNetnsEntry::~NamedNetnsEntry() {
    if (original_ >= 0) {
        setns(original_, CLONE_NEWNET);
        close(original_);
    }
}

}  // namespace platform::testing
