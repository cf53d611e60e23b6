#include <gtest/gtest.h>

#include "diagnostics/DiagnosticResult.h"

namespace {

using diagnostics::DiagnosticResult;

TEST(DiagnosticTexts, EveryRowOfBothTablesAndTheDecimalFallBack) {
    const std::pair<int32_t, const char*> errors[] = {
        {0, "Success"},
        {1, "Test has not been run."},
        {2, "2"},
        {3,
         "The network interface with the best route to the internet does not have a gateway "
         "configured."},
        {4, "This computer does not have a route to the Internet."},
        {5, "The ping test timed out."},
        {6, "6"},
        {7, "Could not resolve the UDP Port 3478 Server Name."},
        {8, "Could not resolve multiple server names."},
        {9, "9"},
        {10, "Could not contact the UDP Port 3478 Server."},
        {11, "11"},
        {14, "Cannot connect to Echo Server."},
        {15, "Error sending Echo Server login request."},
        {16, "Error receiving Echo Server login reply."},
        {17, "17"},
        {26, "26"},
        {27, "UDP Send Failed."},
        {28, "UDP Recv Failed."},
        {29, "TCP Send Failed."},
        {30, "TCP Recv Failed."},
        {31, "No UDP or TCP reply received from Echo Server."},
        {32, "No UDP reply received for Echo Server."},
        {33, "No TCP reply received for Echo Server."},
        {34, "TCP echo reply received from was malformed."},
        {35, "UDP Data was changed on return from the Echo Server."},
        {36, "UDP Data was changed on return from the Echo Server."},
        {37, "UDP Data was changed en route to the Echo Server."},
        {38, "UDP Data was changed en route to the Echo Server."},
        {39, "Login to Echo Server timed out."},
        {40, "40"},
        {42, "Unable to resolve Echo Server name."},
        {43, "43"},
        {-1, "-1"},
    };
    for (const auto& [code, text] : errors) {
        EXPECT_EQ(diagnostics::ErrorText(code), text) << code;
    }
    const char* types[] = {"Interface Location Test",
                           "Gateway Ping Test",
                           "DNS Test",
                           "UDP Port 3478 Test",
                           "Echo Test",
                           "Echo Test/SIP",
                           "Echo Test/SIP Invite Request",
                           "Echo Test/SIP Invite Response",
                           "Echo Test/SIP Register Request",
                           "Echo Test/SIP Register Response",
                           "Echo Test/Media",
                           "Echo Test/Large Packet"};
    for (int32_t type = 0; type < 12; ++type) {
        EXPECT_EQ(diagnostics::TestTypeText(type), types[type]) << type;
    }
    EXPECT_EQ(diagnostics::TestTypeText(12), "12");
    EXPECT_EQ(diagnostics::TestTypeText(-3), "-3");
}

TEST(DiagnosticTexts, EndpointFormWithNoneOneAndTwoEndpoints) {
    EXPECT_EQ(diagnostics::EndpointText(), "");
    EXPECT_EQ(diagnostics::EndpointText(diagnostics::InfoEndpoint{0xC0A80001, 7000}),
              "(192.168.0.1:7000)");
    EXPECT_EQ(diagnostics::EndpointText(diagnostics::InfoEndpoint{0x7F000001, 40001},
                                        diagnostics::InfoEndpoint{0x0A000002, 5060}),
              "(127.0.0.1:40001,10.0.0.2:5060)");
}

TEST(DiagnosticResultMap, StartsNotRunWithoutTheEchoEntryAndRecordReplaces) {
    DiagnosticResult result;
    EXPECT_EQ(result.m_errorCode, PMDR_TEST_NOT_RUN);
    EXPECT_EQ(result.m_testType, 0);
    std::vector<int32_t> types;
    for (const auto& [type, record] : result.m_tests) {
        types.push_back(type);
        EXPECT_EQ(record.m_testType, type);
        EXPECT_EQ(record.m_errorCode, PMDR_TEST_NOT_RUN);
        EXPECT_EQ(record.m_additionalInfo, "");
    }
    EXPECT_EQ(types, (std::vector<int32_t>{0, 1, 2, 3, 5, 6, 7, 8, 9, 10, 11}));

    diagnostics::RecordTestResult(result, PMNTT_TEST_ECHO_SIP_INVITE_REQUEST, 37, "(a)");
    diagnostics::RecordTestResult(result, PMNTT_TEST_ECHO, 14, "(b)");
    diagnostics::RecordTestResult(result, PMNTT_TEST_ECHO_SIP_INVITE_REQUEST, 0, "(c)");
    EXPECT_EQ(result.m_errorCode, 0);
    EXPECT_EQ(result.m_testType, PMNTT_TEST_ECHO_SIP_INVITE_REQUEST);
    EXPECT_EQ(result.m_additionalInfo, "(c)");
    EXPECT_EQ(result.m_tests.size(), 12u);
    EXPECT_EQ(result.m_tests.at(6).m_errorCode, 0);
    EXPECT_EQ(result.m_tests.at(6).m_additionalInfo, "(c)");
    EXPECT_EQ(result.m_tests.at(4).m_errorCode, 14);
    EXPECT_EQ(result.m_tests.at(4).m_additionalInfo, "(b)");
}

}  // namespace
