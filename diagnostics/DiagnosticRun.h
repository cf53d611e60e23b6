// A diagnostic run: on a thread of its own it checks the interface toward a well-known address,
// its gateway, name resolution, STUN on UDP port 3478 and the echo server, then posts its result
// to the window that asked. DiagnosticRuns owns the threads of one window's runs.
#pragma once

#include <atomic>
#include <cstdint>
#include <list>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "diagnostics/DiagnosticResult.h"
#include "platform/kernel.h"
#include "platform/message.h"
#include "platform/netinfo.h"

namespace diagnostics {

// The name the DNS test falls back on to tell "this name failed" from "no name resolves".
inline constexpr const char* kPublicHostName = "a.root-servers.net";
inline constexpr uint16_t kStunTestPort = 3478;

struct DiagnosticRequest {
    platform::WindowHandle m_window = nullptr;
    platform::UINT m_message = 0;
    int32_t m_cookie = 0;
    std::string m_wellKnownNetworkAddress;
    std::string m_stunServer;
    std::string m_echoServer;
    uint16_t m_echoServerPort = 0;
    uint32_t m_timeout = 0;
};

// What a run asks the system; the system's by default, and whatever is given outlives the runs.
struct DiagnosticServices {
    platform::NetworkInfo* networkInfo = &platform::SystemNetworkInfo();
    platform::RouteLookup* routeLookup = &platform::SystemRouteLookup();
};

// What a run posts: its result, and the cookie the event must carry.
struct DiagnosticOutcome {
    DiagnosticResult m_result;
    int32_t m_cookie = 0;
};

// The test sequence; stops at the first failing test, every outcome recorded in result.
void RunTestSequence(const DiagnosticRequest& request, DiagnosticResult& result,
                     const DiagnosticServices& services);

// The runs of one window, each on its own thread. Used on the window's thread; the threads only
// hand over their results.
class DiagnosticRuns {
  public:
    DiagnosticRuns() = default;
    // Stops and joins every run, then frees outcomes whose message was never handled.
    ~DiagnosticRuns();
    DiagnosticRuns(const DiagnosticRuns&) = delete;
    DiagnosticRuns& operator=(const DiagnosticRuns&) = delete;

    // Starts a run that posts (request.m_message, outcome, 0) to request.m_window when it ends.
    // 0, or the system's error when no thread could be created.
    int Start(DiagnosticRequest request, const DiagnosticServices& services);
    // The outcome a run posted as wParam, now the caller's; null for anything else.
    std::unique_ptr<DiagnosticOutcome> TakePosted(platform::WPARAM wParam);
    // Asks every run to stop and waits for it. A stopped run posts nothing.
    void StopAll();

  private:
    struct Run {
        // A serial number, not the address: a joined run's node may be reused by the next.
        uint64_t id = 0;
        std::atomic<bool> done{false};  // nothing left for the thread but to return
        platform::Thread thread;        // last: joined before the flag it sets goes
    };

    struct Posted {
        std::unique_ptr<DiagnosticOutcome> outcome;
        uint64_t runId = 0;
    };

    void Post(const Run& run, const DiagnosticRequest& request, DiagnosticOutcome outcome);
    void JoinFinished();

    std::list<Run> m_runs;
    uint64_t m_nextRunId = 1;
    std::mutex m_postedLock;
    std::vector<Posted> m_posted;  // posted and not yet taken
};

}  // namespace diagnostics
