#include "tests/support/os/command.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>

#include "tests/support/os/process.h"

extern char** environ;

namespace platform::testing {

int RunCommand(const std::vector<std::string>& argv, std::string* output) {
    if (argv.empty()) {
        return -1;
    }
    int pipeFds[2] = {-1, -1};
    if (output != nullptr && pipe2(pipeFds, O_CLOEXEC) != 0) {
        return -1;
    }
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    if (output != nullptr) {
        posix_spawn_file_actions_adddup2(&actions, pipeFds[1], STDOUT_FILENO);
    }
    std::vector<char*> args;
    for (const auto& a : argv) {
        args.push_back(const_cast<char*>(a.c_str()));
    }
    args.push_back(nullptr);
    // Also finds the sbin tools (ip, stund) when PATH lacks them.
    const std::string path = FindExecutable(argv[0]);
    pid_t pid = -1;
    const int rc = path.empty()
                       ? ENOENT
                       : posix_spawn(&pid, path.c_str(), &actions, nullptr, args.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (output != nullptr) {
        close(pipeFds[1]);
        if (rc == 0) {
            char buf[4096];
            for (;;) {
                const ssize_t n = read(pipeFds[0], buf, sizeof buf);
                if (n > 0) {
                    output->append(buf, static_cast<size_t>(n));
                } else if (n == 0 || errno != EINTR) {
                    break;
                }
            }
        }
        close(pipeFds[0]);
    }
    if (rc != 0) {
        return -1;
    }
    int status = 0;
    while (waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR) {
            return -1;
        }
    }
    if (WIFEXITED(status)) {
        return WEXITSTATUS(status);
    }
    return WIFSIGNALED(status) ? 128 + WTERMSIG(status) : -1;
}

}  // namespace platform::testing

namespace platform::testing {

std::string CurrentExecutable() {
    char path[4096];
    const ssize_t n = readlink("/proc/self/exe", path, sizeof path - 1);
    return n > 0 ? std::string(path, static_cast<size_t>(n)) : std::string();
}

}  // namespace platform::testing
