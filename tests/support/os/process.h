// Operating-system helpers that only tests need: running a real peer (stund and the like) as a
// child process, and asking whether a UDP socket is bound.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace platform::testing {

// A child process owned by the test: started from an argv, its stdout and stderr appended to a
// file, and on destruction ended with SIGTERM (SIGKILL if it lingers) and reaped. Only its own
// pid is ever signalled. The child also gets SIGTERM if the thread that started it dies, so a
// crashed test leaves no peer behind.
class Process {
  public:
    Process() = default;
    ~Process() { Stop(); }
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;
    Process(Process&& other) noexcept;
    Process& operator=(Process&& other) noexcept;

    // argv[0] is a path or a name looked up in PATH. False if one is already running, the
    // binary is not found or the process cannot be created.
    bool Start(const std::vector<std::string>& argv, const std::string& outputFile);
    // SIGTERM, wait up to waitMs, then SIGKILL; always reaps. Returns the exit status as
    // waitpid gives it, or -1 when nothing was running.
    int Stop(int waitMs = 2000);
    // False once the child has exited (it is then reaped).
    bool IsRunning();
    int Pid() const { return pid_; }

  private:
    int pid_ = -1;
};

// The full path of an executable: name itself when it contains a slash and is executable,
// otherwise the first match in PATH and then in /usr/sbin and /sbin. Empty when not found.
std::string FindExecutable(const std::string& name);

// The id of this process (parallel test processes derive distinct loopback addresses from it).
int CurrentProcessId();

// True when some socket of this host is bound to exactly this UDP address (host order) and port.
bool IsUdpListening(uint32_t hostAddress, uint16_t port);

}  // namespace platform::testing
