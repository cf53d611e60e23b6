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
    platform::Thread& thread = m_threads.emplace_back();
    errno = 0;
    const bool started = thread.Start([this, request = std::move(request), services] {
        DiagnosticOutcome outcome;
        outcome.m_cookie = request.m_cookie;
        RunTestSequence(request, outcome.m_result, services);
        // The owner is going away or shutting down: nobody waits for this outcome.
        if (!platform::CurrentThreadStopRequested()) {
            Post(request, std::move(outcome));
        }
    });
    if (!started) {
        const int error = errno != 0 ? errno : EAGAIN;
        m_threads.pop_back();
        return error;
    }
    return 0;
}

void DiagnosticRuns::Post(const DiagnosticRequest& request, DiagnosticOutcome outcome) {
    std::lock_guard<std::mutex> lock(m_postedLock);
    m_posted.push_back(std::make_unique<DiagnosticOutcome>(std::move(outcome)));
    const auto wParam = reinterpret_cast<platform::WPARAM>(m_posted.back().get());
    if (!platform::PostMessage(request.m_window, request.m_message, wParam, 0)) {
        m_posted.pop_back();  // the window is gone: nobody will take it
    }
}

std::unique_ptr<DiagnosticOutcome> DiagnosticRuns::TakePosted(platform::WPARAM wParam) {
    std::unique_ptr<DiagnosticOutcome> taken;
    {
        std::lock_guard<std::mutex> lock(m_postedLock);
        for (auto it = m_posted.begin(); it != m_posted.end(); ++it) {
            if (reinterpret_cast<platform::WPARAM>(it->get()) == wParam) {
                taken = std::move(*it);
                m_posted.erase(it);
                break;
            }
        }
    }
    JoinFinished();
    return taken;
}

void DiagnosticRuns::StopAll() {
    for (platform::Thread& thread : m_threads) {
        thread.RequestStop();
    }
    for (platform::Thread& thread : m_threads) {
        thread.Join();
    }
    m_threads.clear();
}

size_t DiagnosticRuns::Active() {
    JoinFinished();
    return m_threads.size();
}

void DiagnosticRuns::JoinFinished() {
    m_threads.remove_if([](platform::Thread& thread) {
        if (!thread.HasFinished()) {
            return false;
        }
        thread.Join();
        return true;
    });
}

}  // namespace diagnostics
