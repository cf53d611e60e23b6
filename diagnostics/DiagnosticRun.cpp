#include "diagnostics/DiagnosticRun.h"

#include <cerrno>

#include "diagnostics/EchoServerTests.h"
#include "foundation/NetUtils.h"
#include "platform/net.h"
#include "stun/STUNTransaction.h"

namespace diagnostics {

void RunTestSequence(const DiagnosticRequest& request, DiagnosticResult& result,
                     const DiagnosticServices& services) {
    // A name is not resolved here: only a dotted quad locates an interface.
    const uint32_t wellKnown = platform::InetAddrNet(request.m_wellKnownNetworkAddress);
    uint32_t interfaceIndex = 0;
    if (wellKnown == platform::kInaddrNone ||
        services.routeLookup->BestInterface(wellKnown, &interfaceIndex) != 0) {
        RecordTestResult(result, PMNTT_TEST_LOCATE_INTERFACE, 4, request.m_wellKnownNetworkAddress);
        return;
    }
    std::string address;
    std::string gateway;
    if (!foundation::GetInterfaceAddressAndGateway(interfaceIndex, address, gateway,
                                                   *services.networkInfo)) {
        RecordTestResult(result, PMNTT_TEST_LOCATE_INTERFACE, 3, address);
        return;
    }
    RecordTestResult(result, PMNTT_TEST_LOCATE_INTERFACE, 0, {});

    uint32_t stunServer = 0;
    if (platform::ResolveHostNameNet(request.m_stunServer, &stunServer) != 0) {
        const std::string info = "(" + request.m_stunServer + ", " + kPublicHostName + ")";
        uint32_t publicHost = 0;
        const bool dnsWorks = platform::ResolveHostNameNet(kPublicHostName, &publicHost) == 0;
        RecordTestResult(result, PMNTT_TEST_DNS, dnsWorks ? 7 : 8, info);
        return;
    }
    RecordTestResult(result, PMNTT_TEST_DNS, 0, {});

    const uint32_t local = platform::InetAddrNet(address);
    if (local == platform::kInaddrNone) {
        RecordTestResult(result, PMNTT_TEST_STUN, 9, address);
        return;
    }
    uint16_t localPort = 0;
    stun::CSTUNMessage response;
    uint32_t fromAddress = 0;
    uint16_t fromPort = 0;
    if (!stun::STUN_RunTest(platform::NetToHost32(local), &localPort,
                            platform::NetToHost32(stunServer), kStunTestPort, false, false,
                            response, fromAddress, fromPort)) {
        RecordTestResult(result, PMNTT_TEST_STUN, 10,
                         platform::InetNtoaNet(stunServer) + ":" + std::to_string(kStunTestPort));
        return;
    }
    RecordTestResult(result, PMNTT_TEST_STUN, 0, {});

    RunEchoServerTests(local, request.m_echoServer, request.m_echoServerPort, request.m_timeout,
                       result);
}

DiagnosticRuns::~DiagnosticRuns() {
    StopAll();
}

int DiagnosticRuns::Start(DiagnosticRequest request, const DiagnosticServices& services) {
    JoinFinished();
    Run& run = m_runs.emplace_back();
    run.id = m_nextRunId++;
    errno = 0;
    const bool started = run.thread.Start([this, &run, request = std::move(request), services] {
        DiagnosticOutcome outcome;
        outcome.m_cookie = request.m_cookie;
        RunTestSequence(request, outcome.m_result, services);
        // The owner is going away or shutting down: nobody waits for this outcome.
        if (!platform::CurrentThreadStopRequested()) {
            Post(run, request, std::move(outcome));
        }
        run.done.store(true);
    });
    if (!started) {
        const int error = errno != 0 ? errno : EAGAIN;
        m_runs.pop_back();
        return error;
    }
    return 0;
}

void DiagnosticRuns::Post(const Run& run, const DiagnosticRequest& request,
                          DiagnosticOutcome outcome) {
    std::lock_guard<std::mutex> lock(m_postedLock);
    m_posted.push_back(Posted{std::make_unique<DiagnosticOutcome>(std::move(outcome)), run.id});
    const auto wParam = reinterpret_cast<platform::WPARAM>(m_posted.back().outcome.get());
    if (!platform::PostMessage(request.m_window, request.m_message, wParam, 0)) {
        m_posted.pop_back();  // the window is gone: nobody will take it
    }
}

std::unique_ptr<DiagnosticOutcome> DiagnosticRuns::TakePosted(platform::WPARAM wParam) {
    Posted taken{};
    {
        std::lock_guard<std::mutex> lock(m_postedLock);
        for (auto it = m_posted.begin(); it != m_posted.end(); ++it) {
            if (reinterpret_cast<platform::WPARAM>(it->outcome.get()) == wParam) {
                taken = std::move(*it);
                m_posted.erase(it);
                break;
            }
        }
    }
    // The run that posted has nothing left to do: join it now, so that its thread and
    // descriptors are gone before its event is fired.
    m_runs.remove_if([&](const Run& run) { return run.id == taken.runId; });
    JoinFinished();
    return std::move(taken.outcome);
}

void DiagnosticRuns::StopAll() {
    for (Run& run : m_runs) {
        run.thread.RequestStop();
    }
    m_runs.clear();  // each thread is joined as its run goes
}

void DiagnosticRuns::JoinFinished() {
    // A run that is done has posted (or given up) and only returns: joining it is immediate, so
    // its descriptors are gone by the time its outcome is handled.
    m_runs.remove_if([](const Run& run) { return run.done.load(); });
}

}  // namespace diagnostics
