#include <gtest/gtest.h>

#include <cctype>

#include "diagnostics/EchoProtocol.h"
#include "diagnostics/EchoServerTests.h"
#include "platform/net.h"
#include "tests/support/EchoServer.h"

namespace {

using diagnostics::DiagnosticResult;
using testsupport::EchoServer;
using Fault = EchoServer::Fault;

constexpr uint32_t kLoopback = 0x7F000001;
constexpr uint32_t kTimeoutMs = 400;

DiagnosticResult RunAgainst(const EchoServer& server, const std::string& name = "127.0.0.1") {
    DiagnosticResult result;
    diagnostics::RunEchoServerTests(platform::HostToNet32(kLoopback), name, server.Port(),
                                    kTimeoutMs, result);
    return result;
}

// "(127.0.0.1:P,127.0.0.1:Q)" with decimal ports.
bool IsTwoLoopbackEndpoints(const std::string& text) {
    size_t at = 0;
    auto take = [&](std::string_view part) {
        const bool ok = text.compare(at, part.size(), part) == 0;
        at += part.size();
        return ok;
    };
    auto digits = [&] {
        const size_t start = at;
        while (at < text.size() && std::isdigit(static_cast<unsigned char>(text[at]))) {
            ++at;
        }
        return at > start;
    };
    return take("(127.0.0.1:") && digits() && take(",127.0.0.1:") && digits() && take(")") &&
           at == text.size();
}

// 34 or 38, where the cut of a hostile stream decides which.
constexpr int32_t kReportFault = -1;

void ExpectCode(int32_t got, int32_t expected) {
    if (expected == kReportFault) {
        EXPECT_TRUE(got == 34 || got == 38) << got;
    } else {
        EXPECT_EQ(got, expected);
    }
}

EchoServer::Options With(Fault fault, int datagram = -1) {
    EchoServer::Options o;
    o.fault = fault;
    o.faultyDatagram = datagram;
    return o;
}
EchoServer::Options Without(const char* header) {
    EchoServer::Options o;
    o.missingHeader = header;
    return o;
}

TEST(EchoServerTests, CleanRunAndEachFaultEndWithTheirCodeAndTestType) {
    EchoServer::Options status404;
    status404.status = 404;
    EchoServer::Options slowLogin;
    slowLogin.loginDelayMs = 1000;
    EchoServer::Options hugeId;
    hugeId.sessionId = " " + std::string(5000, 'h');
    const struct {
        const char* name;
        EchoServer::Options options;
        int32_t code;
        int32_t type;
        int32_t registerCode;  // what the first SIP exchange recorded
    } cases[] = {
        {"clean", {}, 0, PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET, 0},
        {"no report", With(Fault::kNoReport), 33, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE, 33},
        {"no echo", With(Fault::kNoEcho), 32, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE, 32},
        {"neither", With(Fault::kNoReportNoEcho), 31, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE, 31},
        {"altered inbound", With(Fault::kAlterInbound), 37, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE,
         37},
        {"altered back", With(Fault::kAlterReturn), 36, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE, 36},
        {"echo cut", With(Fault::kCutEcho), 35, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE, 35},
        {"report in two", With(Fault::kReportInTwo), 0, PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET, 0},
        {"report in three", With(Fault::kReportInThree, 3), 38, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE,
         0},
        {"lying length", With(Fault::kLyingLength), 38, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE, 38},
        {"malformed report", With(Fault::kMalformedReport), 34, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE,
         34},
        {"flooded report", With(Fault::kFloodedReport), 38, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE,
         38},
        {"failed register", With(Fault::kNoReport, 0), 0, PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET, 33},
        {"media echo cut", With(Fault::kCutEcho, 5), 35, PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET, 0},
        // The login reply's tail and the too-long reports run into the next reads: malformed
        // or the wrong size, depending on how the stream was cut.
        {"5000-byte session id", hugeId, kReportFault, PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE,
         kReportFault},
        {"no Status", Without("Status"), 17, PMNTT_TEST_ECHO, 1},
        {"status 404", status404, 18, PMNTT_TEST_ECHO, 1},
        {"no Session-Id", Without("Session-Id"), 19, PMNTT_TEST_ECHO, 1},
        {"no SIP-Port", Without("SIP-Port"), 20, PMNTT_TEST_ECHO, 1},
        {"no Audio-RTP-Port", Without("Audio-RTP-Port"), 21, PMNTT_TEST_ECHO, 1},
        {"no Audio-RTCP-Port", Without("Audio-RTCP-Port"), 22, PMNTT_TEST_ECHO, 1},
        {"no Video-RTP-Port", Without("Video-RTP-Port"), 23, PMNTT_TEST_ECHO, 1},
        {"no Video-RTCP-Port", Without("Video-RTCP-Port"), 24, PMNTT_TEST_ECHO, 1},
        {"slow login", slowLogin, 39, PMNTT_TEST_ECHO, 1},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        EchoServer server(c.options);
        ASSERT_TRUE(server.Start());
        const DiagnosticResult result = RunAgainst(server);
        ExpectCode(result.m_errorCode, c.code);
        EXPECT_EQ(result.m_testType, c.type);
        ExpectCode(result.m_tests.at(PMNTT_TEST_ECHO_SIP_REGISTER_REQUEST).m_errorCode,
                   c.registerCode);
        if (c.type == PMNTT_TEST_ECHO) {
            // The header checks name nothing; the wait for the reply names the server.
            EXPECT_EQ(result.m_additionalInfo,
                      c.code == 39 ? "(127.0.0.1:" + std::to_string(server.Port()) + ")" : "");
            EXPECT_EQ(result.m_tests.at(PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET).m_errorCode, 1);
        } else {
            EXPECT_TRUE(IsTwoLoopbackEndpoints(result.m_additionalInfo)) << result.m_additionalInfo;
            EXPECT_EQ(result.m_tests.count(PMNTT_TEST_ECHO), 0u);
        }
        // Media runs only after a good last SIP exchange.
        const bool mediaRan =
            result.m_tests.at(PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET).m_errorCode != 1;
        EXPECT_EQ(mediaRan, c.type == PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET);
        ASSERT_TRUE(server.WaitIdle(2000));
    }
}

TEST(EchoServerTests, SessionIdReachesEverySampleAndALongOneIsCutInTheMediaLine) {
    EchoServer::Options options;
    options.sessionId = " " + std::string(1500, 's');
    EchoServer server(options);
    ASSERT_TRUE(server.Start());
    const DiagnosticResult result = RunAgainst(server, "localhost");
    EXPECT_EQ(result.m_errorCode, 0);
    EXPECT_EQ(result.m_testType, PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET);
    const std::vector<std::string> got = server.Datagrams();
    ASSERT_EQ(got.size(), 8u);
    const size_t grown = options.sessionId.size() - diagnostics::kSampleCallId.size();
    EXPECT_EQ(got[0].size(), 544 + grown);
    EXPECT_EQ(got[1].size(), 389 + grown);
    EXPECT_EQ(got[2].size(), 945 + grown);
    EXPECT_EQ(got[3].size(), 734 + grown);
    EXPECT_NE(got[0].find("Call-ID: " + options.sessionId + "\r\n"), std::string::npos);
    for (size_t i = 4; i < 8; ++i) {
        EXPECT_EQ(got[i], ("Call-ID: " + options.sessionId).substr(0, 1398));
    }
}

TEST(EchoServerTests, ControlConnectionFailuresNameTheServer) {
    // A port nobody listens on: bound and closed again.
    uint16_t closedPort = 0;
    {
        platform::Socket s = platform::OpenTcpSocket();
        ASSERT_TRUE(platform::BindSocket(s.Get(), kLoopback, 0));
        ASSERT_TRUE(platform::GetSocketName(s.Get(), nullptr, &closedPort));
    }
    DiagnosticResult result;
    diagnostics::RunEchoServerTests(platform::HostToNet32(kLoopback), "127.0.0.1", closedPort,
                                    kTimeoutMs, result);
    EXPECT_EQ(result.m_errorCode, 14);
    EXPECT_EQ(result.m_testType, PMNTT_TEST_ECHO);
    EXPECT_EQ(result.m_additionalInfo, "(127.0.0.1:" + std::to_string(closedPort) + ")");
}

}  // namespace
