#include "diagnostics/EchoServerTests.h"

#include <algorithm>
#include <climits>
#include <vector>

#include "diagnostics/EchoProtocol.h"

namespace diagnostics {

namespace {

int WaitMs(uint32_t timeoutMs) {
    return static_cast<int>(std::min<uint32_t>(timeoutMs, INT_MAX));
}

std::string LocalThenDestination(platform::SocketHandle udp, EchoDestination destination) {
    InfoEndpoint local;
    platform::GetSocketName(udp, &local.m_address, &local.m_port);
    return EndpointText(local, InfoEndpoint{destination.m_address, destination.m_port});
}

// A UDP socket on the interface address with a port the system picks. The bind's outcome is
// not examined: an unbound socket still sends from an ephemeral port.
platform::Socket OpenEchoUdpSocket(uint32_t localAddressNet) {
    platform::Socket s = platform::OpenUdpSocket();
    if (s.IsValid()) {
        platform::BindSocket(s.Get(), platform::NetToHost32(localAddressNet), 0);
    }
    return s;
}

}  // namespace

int RecvWithTimeout(platform::SocketHandle s, char* buffer, size_t length, uint32_t timeoutMs) {
    const int ready = platform::WaitSocketReadable(s, WaitMs(timeoutMs));
    if (ready <= 0) {
        return ready == 0 ? 0 : -1;
    }
    const int n = platform::Receive(s, buffer, length);
    return n < 0 ? -1 : n;
}

void RunEchoExchange(DiagnosticResult& result, int32_t testType, platform::SocketHandle control,
                     platform::SocketHandle udp, EchoDestination destination,
                     std::string_view message, uint32_t timeoutMs) {
    const std::string info = LocalThenDestination(udp, destination);
    const size_t length = message.size();
    if (platform::SendTo(udp, message.data(), length, destination.m_address, destination.m_port) !=
        static_cast<int>(length)) {
        RecordTestResult(result, testType, 27, info);
        return;
    }
    // Room for the whole message even when a long session id made it bigger than the usual
    // buffer, and a zero after it.
    std::vector<char> echo(std::max(kEchoBufferSize, length + 1), 0);
    const int echoed = RecvWithTimeout(udp, echo.data(), length, timeoutMs);
    if (echoed < 0) {
        RecordTestResult(result, testType, 28, info);
        return;
    }
    std::vector<char> report(kEchoBufferSize, 0);
    const int reported = RecvWithTimeout(control, report.data(), report.size(), timeoutMs);
    if (reported < 0) {
        RecordTestResult(result, testType, 30, info);
        return;
    }
    if (reported == 0) {
        RecordTestResult(result, testType, echoed > 0 ? 33 : 31, info);
        return;
    }
    size_t used = static_cast<size_t>(reported);
    const auto parsed = ParseEchoReport(AsText(report.data(), used));
    if (!parsed) {
        RecordTestResult(result, testType, 34, info);
        return;
    }
    if (parsed->m_length != static_cast<long>(length)) {
        RecordTestResult(result, testType, 38, info);
        return;
    }
    const size_t have = AsText(report.data(), used).size() - parsed->m_payloadOffset;
    if (have < length) {
        // One more receive for the rest, never beyond the buffer whatever the report claims.
        const size_t room = report.size() - used;
        const size_t missing = std::min(length - have, room);
        if (missing > 0) {
            const int more = RecvWithTimeout(control, report.data() + used, missing, timeoutMs);
            if (more <= 0) {
                RecordTestResult(result, testType, 30, info);
                return;
            }
            used += static_cast<size_t>(more);
        }
    }
    const std::string_view payload =
        AsText(report.data(), used).substr(std::min(parsed->m_payloadOffset, used));
    if (payload.size() != length) {
        RecordTestResult(result, testType, 38, info);
        return;
    }
    if (payload != message) {
        RecordTestResult(result, testType, 37, info);
        return;
    }
    if (echoed == 0) {
        RecordTestResult(result, testType, 32, info);
        return;
    }
    const std::string_view back = AsText(echo.data(), static_cast<size_t>(echoed));
    if (back.size() != length) {
        RecordTestResult(result, testType, 35, info);
        return;
    }
    if (back != message) {
        RecordTestResult(result, testType, 36, info);
        return;
    }
    RecordTestResult(result, testType, 0, info);
}

void RunEchoServerTests(uint32_t localAddressNet, const std::string& echoServer, uint16_t echoPort,
                        uint32_t timeoutMs, DiagnosticResult& result) {
    platform::Socket control = platform::OpenTcpSocket();
    if (!control.IsValid()) {
        RecordTestResult(result, PMNTT_TEST_ECHO, 11, {});
        return;
    }
    uint32_t serverNet = platform::InetAddrNet(echoServer);
    if (serverNet == platform::kInaddrNone &&
        platform::ResolveHostNameNet(echoServer, &serverNet) != 0) {
        RecordTestResult(result, PMNTT_TEST_ECHO, 42, echoServer);
        return;
    }
    const uint32_t server = platform::NetToHost32(serverNet);
    const std::string serverInfo = EndpointText(InfoEndpoint{server, echoPort});
    if (platform::ConnectSocket(control.Get(), server, echoPort, WaitMs(timeoutMs)) != 0) {
        RecordTestResult(result, PMNTT_TEST_ECHO, 14, serverInfo);
        return;
    }
    if (platform::Send(control.Get(), kEchoLoginRequest.data(), kEchoLoginRequest.size()) !=
        static_cast<int>(kEchoLoginRequest.size())) {
        RecordTestResult(result, PMNTT_TEST_ECHO, 15, serverInfo);
        return;
    }
    std::vector<char> reply(kEchoBufferSize, 0);
    const int got = RecvWithTimeout(control.Get(), reply.data(), reply.size(), timeoutMs);
    if (got <= 0) {
        RecordTestResult(result, PMNTT_TEST_ECHO, got < 0 ? 16 : 39, serverInfo);
        return;
    }
    EchoLogin login;
    const int32_t loginCode =
        ParseLoginReply(AsText(reply.data(), static_cast<size_t>(got)), login);
    if (loginCode != 0) {
        RecordTestResult(result, PMNTT_TEST_ECHO, loginCode, {});
        return;
    }

    {
        platform::Socket sip = OpenEchoUdpSocket(localAddressNet);
        if (!sip.IsValid()) {
            RecordTestResult(result, PMNTT_TEST_ECHO_SIP, 25, {});
            return;
        }
        const EchoDestination to{server, login.m_sipPort};
        const struct {
            int32_t type;
            std::string_view sample;
        } exchanges[] = {
            {PMNTT_TEST_ECHO_SIP_REGISTER_REQUEST, SipRegisterRequest()},
            {PMNTT_TEST_ECHO_SIP_REGISTER_RESPONSE, SipRegisterResponse()},
            {PMNTT_TEST_ECHO_SIP_INVITE_REQUEST, SipInviteRequest()},
            {PMNTT_TEST_ECHO_SIP_INVITE_RESPONSE, SipInviteResponse()},
        };
        for (const auto& exchange : exchanges) {
            RunEchoExchange(result, exchange.type, control.Get(), sip.Get(), to,
                            WithSessionId(exchange.sample, login.m_sessionId), timeoutMs);
        }
    }

    const std::string payload = MakeMediaPayload(login.m_sessionId);
    for (uint16_t port : {login.m_audioRtpPort, login.m_audioRtcpPort, login.m_videoRtpPort,
                          login.m_videoRtcpPort}) {
        if (result.m_errorCode != 0) {
            break;
        }
        platform::Socket media = OpenEchoUdpSocket(localAddressNet);
        if (!media.IsValid()) {
            RecordTestResult(result, PMNTT_TEST_ECHO_MEDIA, 26, {});
            return;
        }
        RunEchoExchange(result, PMNTT_TEST_ECHO_MEDIA_LARGE_PACKET, control.Get(), media.Get(),
                        EchoDestination{server, port}, payload, timeoutMs);
    }
}

}  // namespace diagnostics
