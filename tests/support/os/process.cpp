#include "tests/support/os/process.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <thread>
#include <utility>

namespace platform::testing {

namespace {

bool IsExecutableFile(const std::string& path) {
    struct stat st {};
    return stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) && access(path.c_str(), X_OK) == 0;
}

}  // namespace

std::string FindExecutable(const std::string& name) {
    if (name.empty()) {
        return {};
    }
    if (name.find('/') != std::string::npos) {
        return IsExecutableFile(name) ? name : std::string();
    }
    std::string dirs;
    if (const char* path = std::getenv("PATH")) {
        dirs = path;
    }
    // Daemons live in sbin, which a plain user's PATH often lacks.
    dirs += ":/usr/sbin:/sbin";
    std::stringstream list(dirs);
    std::string dir;
    while (std::getline(list, dir, ':')) {
        if (dir.empty()) {
            continue;
        }
        const std::string candidate = dir + "/" + name;
        if (IsExecutableFile(candidate)) {
            return candidate;
        }
    }
    return {};
}

Process::Process(Process&& other) noexcept : pid_(std::exchange(other.pid_, -1)) {}

Process& Process::operator=(Process&& other) noexcept {
    if (this != &other) {
        Stop();
        pid_ = std::exchange(other.pid_, -1);
    }
    return *this;
}

bool Process::Start(const std::vector<std::string>& argv, const std::string& outputFile) {
    if (pid_ > 0 || argv.empty()) {
        return false;
    }
    const std::string path = FindExecutable(argv[0]);
    if (path.empty()) {
        return false;
    }
    // Everything the child needs is prepared before fork: after it only async-signal-safe calls.
    std::vector<char*> args;
    args.reserve(argv.size() + 1);
    for (const std::string& a : argv) {
        args.push_back(const_cast<char*>(a.c_str()));
    }
    args.push_back(nullptr);
    const int out = open(outputFile.empty() ? "/dev/null" : outputFile.c_str(),
                         O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (out < 0) {
        return false;
    }
    const pid_t parent = getpid();
    const pid_t pid = fork();
    if (pid == 0) {
        prctl(PR_SET_PDEATHSIG, SIGTERM);
        if (getppid() != parent) {
            _exit(127);  // the parent died before prctl took effect
        }
        const int devnull = open("/dev/null", O_RDONLY);
        if (devnull >= 0) {
            dup2(devnull, STDIN_FILENO);
        }
        dup2(out, STDOUT_FILENO);
        dup2(out, STDERR_FILENO);
        execv(path.c_str(), args.data());
        _exit(127);
    }
    close(out);
    if (pid < 0) {
        return false;
    }
    pid_ = pid;
    return true;
}

bool Process::IsRunning() {
    if (pid_ <= 0) {
        return false;
    }
    int status = 0;
    const pid_t r = waitpid(pid_, &status, WNOHANG);
    if (r == pid_ || (r < 0 && errno == ECHILD)) {
        pid_ = -1;
        return false;
    }
    return true;
}

int Process::Stop(int waitMs) {
    if (pid_ <= 0) {
        return -1;
    }
    const pid_t pid = std::exchange(pid_, -1);
    kill(pid, SIGTERM);
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(waitMs);
    int status = 0;
    for (;;) {
        const pid_t r = waitpid(pid, &status, WNOHANG);
        if (r == pid) {
            return status;
        }
        if (r < 0 && errno != EINTR) {
            return -1;
        }
        if (std::chrono::steady_clock::now() >= deadline) {
            break;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    kill(pid, SIGKILL);
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    return status;
}

int CurrentProcessId() {
    return static_cast<int>(getpid());
}

bool IsUdpListening(uint32_t hostAddress, uint16_t port) {
    std::ifstream table("/proc/net/udp");
    if (!table) {
        return false;
    }
    // The kernel prints the address as the in-memory (network order) word in hex.
    char wanted[16];
    std::snprintf(wanted, sizeof wanted, "%08X:%04X", static_cast<unsigned>(htonl(hostAddress)),
                  static_cast<unsigned>(port));
    std::string line;
    std::getline(table, line);  // header
    while (std::getline(table, line)) {
        std::istringstream fields(line);
        std::string slot;
        std::string local;
        if (fields >> slot >> local && local == wanted) {
            return true;
        }
    }
    return false;
}

}  // namespace platform::testing
