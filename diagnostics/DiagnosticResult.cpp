#include "diagnostics/DiagnosticResult.h"

#include "foundation/NetUtils.h"

namespace diagnostics {

DiagnosticResult::DiagnosticResult() {
    for (int32_t type : {0, 1, 2, 3, 5, 6, 7, 8, 9, 10, 11}) {
        m_tests[type] = DiagnosticTestRecord{PMDR_TEST_NOT_RUN, type, {}};
    }
}

void RecordTestResult(DiagnosticResult& result, int32_t testType, int32_t errorCode,
                      const std::string& info) {
    result.m_errorCode = errorCode;
    result.m_testType = testType;
    result.m_additionalInfo = info;
    result.m_tests[testType] = DiagnosticTestRecord{errorCode, testType, info};
}

std::string ErrorText(int32_t errorCode) {
    switch (errorCode) {
        case 0:
            return "Success";
        case 1:
            return "Test has not been run.";
        case 3:
            return "The network interface with the best route to the internet does not have a "
                   "gateway configured.";
        case 4:
            return "This computer does not have a route to the Internet.";
        case 5:
            return "The ping test timed out.";
        case 7:
            return "Could not resolve the UDP Port 3478 Server Name.";
        case 8:
            return "Could not resolve multiple server names.";
        case 10:
            return "Could not contact the UDP Port 3478 Server.";
        case 14:
            return "Cannot connect to Echo Server.";
        case 15:
            return "Error sending Echo Server login request.";
        case 16:
            return "Error receiving Echo Server login reply.";
        case 27:
            return "UDP Send Failed.";
        case 28:
            return "UDP Recv Failed.";
        case 29:
            return "TCP Send Failed.";
        case 30:
            return "TCP Recv Failed.";
        case 31:
            return "No UDP or TCP reply received from Echo Server.";
        case 32:
            return "No UDP reply received for Echo Server.";
        case 33:
            return "No TCP reply received for Echo Server.";
        case 34:
            return "TCP echo reply received from was malformed.";
        case 35:
        case 36:
            return "UDP Data was changed on return from the Echo Server.";
        case 37:
        case 38:
            return "UDP Data was changed en route to the Echo Server.";
        case 39:
            return "Login to Echo Server timed out.";
        case 42:
            return "Unable to resolve Echo Server name.";
        default:
            return std::to_string(errorCode);
    }
}

std::string TestTypeText(int32_t testType) {
    switch (testType) {
        case 0:
            return "Interface Location Test";
        case 1:
            return "Gateway Ping Test";
        case 2:
            return "DNS Test";
        case 3:
            return "UDP Port 3478 Test";
        case 4:
            return "Echo Test";
        case 5:
            return "Echo Test/SIP";
        case 6:
            return "Echo Test/SIP Invite Request";
        case 7:
            return "Echo Test/SIP Invite Response";
        case 8:
            return "Echo Test/SIP Register Request";
        case 9:
            return "Echo Test/SIP Register Response";
        case 10:
            return "Echo Test/Media";
        case 11:
            return "Echo Test/Large Packet";
        default:
            return std::to_string(testType);
    }
}

namespace {
std::string OneEndpoint(const InfoEndpoint& e) {
    return foundation::FormatHostAddress(e.m_address) + ":" + std::to_string(e.m_port);
}
}  // namespace

std::string EndpointText(std::optional<InfoEndpoint> first, std::optional<InfoEndpoint> second) {
    if (!first) {
        return {};
    }
    std::string text = "(" + OneEndpoint(*first);
    if (second) {
        text += "," + OneEndpoint(*second);
    }
    return text + ")";
}

}  // namespace diagnostics
