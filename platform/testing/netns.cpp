#include "platform/testing/netns.h"

#include <fcntl.h>
#include <sched.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <sstream>

#include "platform/testing/process.h"

extern char** environ;

namespace platform::testing {

bool IsRoot() {
    return geteuid() == 0;
}

int RunProgram(const std::vector<std::string>& argv) {
    if (argv.empty()) {
        return -1;
    }
    const std::string path = FindExecutable(argv[0]);
    if (path.empty()) {
        return -1;
    }
    std::vector<char*> args;
    for (const std::string& a : argv) {
        args.push_back(const_cast<char*>(a.c_str()));
    }
    args.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    if (posix_spawn_file_actions_init(&actions) != 0) {
        return -1;
    }
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    pid_t pid = -1;
    const int spawned = posix_spawn(&pid, path.c_str(), &actions, nullptr, args.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (spawned != 0) {
        return -1;
    }
    int status = 0;
    while (waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR) {
            return -1;
        }
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

namespace {
std::atomic<int> g_counter{0};
}

ScopedNetns::ScopedNetns(const std::string& prefix)
    : name_(prefix + "-" + std::to_string(getpid()) + "-" + std::to_string(g_counter++)) {
    if (RunProgram({"ip", "netns", "add", name_}) != 0) {
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
    RunProgram({"ip", "netns", "delete", name_});
}

bool ScopedNetns::Ip(const std::string& arguments) const {
    std::vector<std::string> argv{"ip", "-n", name_};
    std::istringstream words(arguments);
    std::string word;
    while (words >> word) {
        argv.push_back(word);
    }
    return RunProgram(argv) == 0;
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
