// Diagnostic runs against the system's own answers: routes, adapters and gateways of a network
// namespace the test makes, and name look-ups against a name server of its own.
#include <gtest/gtest.h>

#include <chrono>

#include "diagnostics/DiagnosticRun.h"
#include "foundation/NetUtils.h"
#include "portmanager/AdvancedPortManager.h"
#include "tests/support/DnsLab.h"
#include "tests/support/EchoServer.h"
#include "tests/support/FakeNetworkInfo.h"
#include "tests/support/Stund.h"
#include "tests/support/os/netns.h"

namespace {

using diagnostics::DiagnosticRequest;
using diagnostics::DiagnosticResult;

// The sequence on this thread, as a run's thread would do it.
DiagnosticResult RunSequence(const std::string& wellKnown, const std::string& stun,
                             const std::string& echo, uint16_t echoPort,
                             const diagnostics::DiagnosticServices& services = {}) {
    DiagnosticRequest request;
    request.m_wellKnownNetworkAddress = wellKnown;
    request.m_stunServer = stun;
    request.m_echoServer = echo;
    request.m_echoServerPort = echoPort;
    request.m_timeout = 1000;
    DiagnosticResult result;
    diagnostics::RunTestSequence(request, result, services);
    return result;
}

TEST(LabDiagnose, NoRouteNoGatewayAndACleanRunFromTheSystemsAnswers) {
    if (!platform::testing::IsRoot() || !testsupport::Stund::IsInstalled()) {
        GTEST_SKIP() << "needs root and stund";
    }
    platform::testing::ScopedNetns ns("nqdiag");
    ASSERT_TRUE(ns.IsValid());
    ASSERT_TRUE(ns.Ip("link add nqd0 type veth peer name nqd1"));
    ASSERT_TRUE(ns.Ip("link set nqd1 up"));
    ASSERT_TRUE(ns.Ip("addr add 10.77.0.2/24 dev nqd0"));
    ASSERT_TRUE(ns.Ip("link set nqd0 up"));
    ASSERT_TRUE(ns.Enter());

    DiagnosticResult r = RunSequence("192.0.2.1", "127.0.0.1", "127.0.0.1", 7000);
    EXPECT_EQ(r.m_errorCode, 4);
    EXPECT_EQ(r.m_testType, PMNTT_TEST_LOCATE_INTERFACE);
    EXPECT_EQ(r.m_additionalInfo, "192.0.2.1");

    // A route on the link, but no gateway.
    r = RunSequence("10.77.0.1", "127.0.0.1", "127.0.0.1", 7000);
    EXPECT_EQ(r.m_errorCode, 3);
    EXPECT_EQ(r.m_testType, PMNTT_TEST_LOCATE_INTERFACE);
    EXPECT_EQ(r.m_additionalInfo, "");

    ASSERT_TRUE(ns.Ip("route add default via 10.77.0.1"));
    testsupport::Stund stund;
    std::string why;
    ASSERT_TRUE(stund.Start(&why)) << why;
    testsupport::EchoServer echo;
    ASSERT_TRUE(echo.Start());
    r = RunSequence("192.0.2.1", foundation::FormatHostAddress(stund.PrimaryAddress()), "127.0.0.1",
                    echo.Port());
    EXPECT_EQ(r.m_errorCode, 0) << r.m_testType << " " << r.m_additionalInfo;
    EXPECT_EQ(r.m_testType, PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET);
    // The echoes went out from the interface toward the Internet.
    EXPECT_EQ(r.m_additionalInfo.rfind("(10.77.0.2:", 0), 0u) << r.m_additionalInfo;
}

// A network where the well-known address has a route and a gateway, so that the run gets to
// the name look-ups.
struct GatewayNetwork {
    GatewayNetwork() {
        net.AddInterface("127.0.0.1", "127.0.0.254");
        services.networkInfo = &net;
        services.routeLookup = &routes;
    }
    struct : platform::RouteLookup {
        int BestInterface(uint32_t, uint32_t* index) override {
            *index = 1;
            return 0;
        }
    } routes;
    testsupport::FakeNetworkInfo net;
    diagnostics::DiagnosticServices services;
};

TEST(LabDiagnoseDns, UnknownNamesWithWorkingDns) {
    NQPM_RUN_INSIDE_DNS_LAB(
        "LabDiagnoseDns.UnknownNamesWithWorkingDns",
        std::vector<std::string>{std::string(diagnostics::kPublicHostName) + ",127.0.0.53"})
    GatewayNetwork network;
    const std::string unknown = testsupport::DnsLab::kUnknownName;
    DiagnosticResult r = RunSequence("192.0.2.1", unknown, "127.0.0.1", 7000, network.services);
    EXPECT_EQ(r.m_errorCode, 7);
    EXPECT_EQ(r.m_testType, PMNTT_TEST_DNS);
    EXPECT_EQ(r.m_additionalInfo, "(" + unknown + ", a.root-servers.net)");
    EXPECT_EQ(r.m_tests.at(PMNTT_TEST_STUN).m_errorCode, PMDR_TEST_NOT_RUN);

    // A STUN name that resolves passes the DNS test; here nobody answers on it.
    r = RunSequence("192.0.2.1", testsupport::DnsLab::kKnownName, "127.0.0.1", 7000,
                    network.services);
    EXPECT_EQ(r.m_tests.at(PMNTT_TEST_DNS).m_errorCode, 0);
    EXPECT_EQ(r.m_errorCode, 10);
    EXPECT_EQ(r.m_additionalInfo, "127.0.0.1:3478");

    if (!testsupport::Stund::IsInstalled()) {
        return;
    }
    testsupport::Stund stund;
    std::string why;
    ASSERT_TRUE(stund.Start(&why)) << why;
    r = RunSequence("192.0.2.1", foundation::FormatHostAddress(stund.PrimaryAddress()), unknown,
                    7000, network.services);
    EXPECT_EQ(r.m_errorCode, 42);
    EXPECT_EQ(r.m_testType, PMNTT_TEST_ECHO);
    EXPECT_EQ(r.m_additionalInfo, unknown);
}

TEST(LabDiagnoseDns, NoNameResolves) {
    NQPM_RUN_INSIDE_DNS_LAB("LabDiagnoseDns.NoNameResolves", std::vector<std::string>{})
    GatewayNetwork network;
    const DiagnosticResult r = RunSequence("192.0.2.1", testsupport::DnsLab::kUnknownName,
                                           "127.0.0.1", 7000, network.services);
    EXPECT_EQ(r.m_errorCode, 8);
    EXPECT_EQ(r.m_testType, PMNTT_TEST_DNS);
    EXPECT_EQ(r.m_additionalInfo,
              std::string("(") + testsupport::DnsLab::kUnknownName + ", a.root-servers.net)");
}

TEST(LabDiagnoseDns, ShutdownEndsARunWaitingForASilentNameServer) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "ThreadSanitizer builds resolve without interruption (the resolver's own "
                    "threads are invisible to it)";
#endif
    NQPM_RUN_INSIDE_DNS_LAB("LabDiagnoseDns.ShutdownEndsARunWaitingForASilentNameServer",
                            std::vector<std::string>{}, false)
    // The name server: receives the question and never answers.
    platform::Socket silent = platform::OpenUdpSocket();
    ASSERT_TRUE(platform::BindSocket(silent.Get(), 0x7F000001, 53));
    GatewayNetwork network;
    portmanager::PortManagerServices services;
    services.networkInfo = network.services.networkInfo;
    services.routeLookup = network.services.routeLookup;
    IAdvancedPortManager* pm = nullptr;
    ASSERT_EQ(portmanager::CAdvancedPortManager::CreateInstance(
                  IID_IAdvancedPortManager, reinterpret_cast<void**>(&pm), services),
              S_OK);
    BStr wellKnown("192.0.2.1"), stun(testsupport::DnsLab::kKnownName), echo("127.0.0.1");
    ASSERT_EQ(pm->DiagnoseNetwork(wellKnown.Get(), stun.Get(), echo.Get(), 7000, 1000, 1), S_OK);
    ASSERT_EQ(platform::WaitSocketReadable(silent.Get(), 5000), 1);  // the run asks and waits
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(pm->Shutdown(), S_OK);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(1000));
    pm->Release();
}

}  // namespace
