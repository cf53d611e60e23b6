#include "diagnostics/EchoProtocol.h"

#include <climits>
#include <cstring>

namespace diagnostics {

namespace {

constexpr char kSipRegisterRequest[] =
    "REGISTER sip:lab.test SIP/2.0\r\n"
    "Via: SIP/2.0/UDP "
    "192.0.2.10:5060;rport;branch="
    "z9hG4bK9c4e1a7f3b05d28e6a4c9c4e1a7f3b05d28e6a4c9c4e1a7f3b05d28e6a4c9c4e\r\n"
    "Max-Forwards: 70\r\n"
    "From: <sip:alice@lab.test>;tag=nq1a2b3c\r\n"
    "To: <sip:alice@lab.test>\r\n"
    "Call-ID: 6f1c9e2a4b7d08e35a92c4f1d0b8e7a3\r\n"
    "CSeq: 1 REGISTER\r\n"
    "Contact: <sip:alice@192.0.2.10:5060;transport=udp>;expires=3600\r\n"
    "Allow: INVITE, ACK, CANCEL, BYE, OPTIONS, INFO, MESSAGE, NOTIFY, REFER\r\n"
    "Supported: replaces, timer\r\n"
    "User-Agent: NqPortManager network diagnostics\r\n"
    "Expires: 3600\r\n"
    "Content-Length: 0\r\n"
    "\r\n";
constexpr char kSipRegisterResponse[] =
    "SIP/2.0 200 OK\r\n"
    "Via: SIP/2.0/UDP "
    "192.0.2.10:5060;rport=5060;received=192.0.2.10;branch="
    "z9hG4bK9c4e1a7f3b05d28e6a4c9c4e1a7f3b05d28e6\r\n"
    "From: <sip:alice@lab.test>;tag=nq1a2b3c\r\n"
    "To: <sip:alice@lab.test>;tag=srv9f8e7d\r\n"
    "Call-ID: 6f1c9e2a4b7d08e35a92c4f1d0b8e7a3\r\n"
    "CSeq: 1 REGISTER\r\n"
    "Contact: <sip:alice@192.0.2.10:5060;transport=udp>;expires=3600\r\n"
    "Server: NqPortManager echo\r\n"
    "Content-Length: 0\r\n"
    "\r\n";
constexpr char kSipInviteRequest[] =
    "INVITE sip:bob@lab.test SIP/2.0\r\n"
    "Via: SIP/2.0/UDP 192.0.2.10:5060;rport;branch=z9hG4bK9c4e1a7f3b05d28e6a4c9c4e1\r\n"
    "Max-Forwards: 70\r\n"
    "From: <sip:alice@lab.test>;tag=nq4d5e6f\r\n"
    "To: <sip:bob@lab.test>\r\n"
    "Call-ID: 6f1c9e2a4b7d08e35a92c4f1d0b8e7a3\r\n"
    "CSeq: 1 INVITE\r\n"
    "Contact: <sip:alice@192.0.2.10:5060;transport=udp>\r\n"
    "User-Agent: NqPortManager network diagnostics\r\n"
    "Content-Type: application/sdp\r\n"
    "Content-Length: 537\r\n"
    "\r\n"
    "v=0\r\n"
    "o=alice 2890844526 2890844526 IN IP4 192.0.2.10\r\n"
    "s=NqPortManager diagnostics\r\n"
    "i=Echo check of the media path through NATs and firewalls between this client and\r\n"
    "c=IN IP4 192.0.2.10\r\n"
    "t=0 0\r\n"
    "m=audio 49170 RTP/AVP 0 8 18 101\r\n"
    "a=rtpmap:0 PCMU/8000\r\n"
    "a=rtpmap:8 PCMA/8000\r\n"
    "a=rtpmap:18 G729/8000\r\n"
    "a=fmtp:18 annexb=no\r\n"
    "a=rtpmap:101 telephone-event/8000\r\n"
    "a=fmtp:101 0-15\r\n"
    "a=ptime:20\r\n"
    "a=sendrecv\r\n"
    "m=video 51372 RTP/AVP 34 96\r\n"
    "a=rtpmap:34 H263/90000\r\n"
    "a=rtpmap:96 H264/90000\r\n"
    "a=fmtp:96 profile-level-id=42e01f;packetization-mode=1\r\n"
    "a=sendrecv\r\n";
constexpr char kSipInviteResponse[] =
    "SIP/2.0 200 OK\r\n"
    "Via: SIP/2.0/UDP "
    "192.0.2.10:5060;rport=5060;received=192.0.2.10;branch="
    "z9hG4bK9c4e1a7f3b05d28e6a4c9c4e1a7f3b05d28e6a4c9c4e1a7f3b05d28e6a4c9c4e1a7f3b05d28e6a4c9c4e1a7"
    "f3b05d28e6a4c9c4e1a7f3b\r\n"
    "From: <sip:alice@lab.test>;tag=nq4d5e6f\r\n"
    "To: <sip:bob@lab.test>;tag=srv1b2c3d\r\n"
    "Call-ID: 6f1c9e2a4b7d08e35a92c4f1d0b8e7a3\r\n"
    "CSeq: 1 INVITE\r\n"
    "Contact: <sip:bob@192.0.2.20:5060;transport=udp>\r\n"
    "Server: NqPortManager echo\r\n"
    "Allow: INVITE, ACK, CANCEL, BYE, OPTIONS\r\n"
    "Content-Type: application/sdp\r\n"
    "Content-Length: 216\r\n"
    "\r\n"
    "v=0\r\n"
    "o=bob 2808844564 1 IN IP4 192.0.2.20\r\n"
    "s=-\r\n"
    "i=Echo check of the media \r\n"
    "c=IN IP4 192.0.2.20\r\n"
    "t=0 0\r\n"
    "m=audio 3456 RTP/AVP 0 101\r\n"
    "a=rtpmap:101 telephone-event/8000\r\n"
    "m=video 3458 RTP/AVP 96\r\n"
    "a=rtpmap:96 H264/90000\r\n";

static_assert(sizeof kSipRegisterRequest - 1 == 544);
static_assert(sizeof kSipRegisterResponse - 1 == 389);
static_assert(sizeof kSipInviteRequest - 1 == 945);
static_assert(sizeof kSipInviteResponse - 1 == 734);

}  // namespace

std::string_view SipRegisterRequest() {
    return {kSipRegisterRequest, sizeof kSipRegisterRequest - 1};
}
std::string_view SipRegisterResponse() {
    return {kSipRegisterResponse, sizeof kSipRegisterResponse - 1};
}
std::string_view SipInviteRequest() {
    return {kSipInviteRequest, sizeof kSipInviteRequest - 1};
}
std::string_view SipInviteResponse() {
    return {kSipInviteResponse, sizeof kSipInviteResponse - 1};
}

std::optional<std::string_view> HeaderValue(std::string_view text, std::string_view name) {
    size_t at = 0;
    while ((at = text.find(name, at)) != std::string_view::npos) {
        const size_t colon = at + name.size();
        if (colon < text.size() && text[colon] == ':') {
            const std::string_view rest = text.substr(colon + 1);
            return rest.substr(0, rest.find("\r\n"));
        }
        at += 1;
    }
    return std::nullopt;
}

long ParseDecimal(std::string_view text) {
    size_t at = 0;
    while (at < text.size() && (text[at] == ' ' || (text[at] >= '\t' && text[at] <= '\r'))) {
        ++at;
    }
    bool negative = false;
    if (at < text.size() && (text[at] == '+' || text[at] == '-')) {
        negative = text[at] == '-';
        ++at;
    }
    long value = 0;
    for (; at < text.size() && text[at] >= '0' && text[at] <= '9'; ++at) {
        const int digit = text[at] - '0';
        if (value > (LONG_MAX - digit) / 10) {
            value = LONG_MAX;
            continue;
        }
        value = value * 10 + digit;
    }
    return negative ? -value : value;
}

int32_t ParseLoginReply(std::string_view text, EchoLogin& login) {
    const auto status = HeaderValue(text, "Status");
    if (!status) {
        return 17;
    }
    if (ParseDecimal(*status) != 200) {
        return 18;
    }
    const auto sessionId = HeaderValue(text, "Session-Id");
    if (!sessionId) {
        return 19;
    }
    login.m_sessionId = std::string(*sessionId);
    struct Port {
        const char* name;
        uint16_t EchoLogin::*field;
        int32_t missing;
    };
    static constexpr Port kPorts[] = {
        {"SIP-Port", &EchoLogin::m_sipPort, 20},
        {"Audio-RTP-Port", &EchoLogin::m_audioRtpPort, 21},
        {"Audio-RTCP-Port", &EchoLogin::m_audioRtcpPort, 22},
        {"Video-RTP-Port", &EchoLogin::m_videoRtpPort, 23},
        {"Video-RTCP-Port", &EchoLogin::m_videoRtcpPort, 24},
    };
    for (const Port& port : kPorts) {
        const auto value = HeaderValue(text, port.name);
        if (!value) {
            return port.missing;
        }
        login.*port.field = static_cast<uint16_t>(static_cast<unsigned long>(ParseDecimal(*value)));
    }
    return 0;
}

std::string WithSessionId(std::string_view sample, std::string_view sessionId) {
    std::string message(sample);
    const size_t at = message.find(kSampleCallId);
    if (at != std::string::npos) {
        message.replace(at, kSampleCallId.size(), sessionId);
    }
    return message;
}

std::string MakeMediaPayload(std::string_view sessionId) {
    std::string line = "Call-ID: ";
    line += sessionId;
    line += "\r\n";
    std::string payload = line.substr(0, kMediaPayloadSize);
    for (size_t position = payload.size(); position < kMediaPayloadSize; ++position) {
        payload.push_back(static_cast<char>((position | 1) % 256));
    }
    return payload;
}

std::optional<EchoReport> ParseEchoReport(std::string_view text) {
    static constexpr std::string_view kLength = "Content-Length: ";
    const size_t header = text.find(kLength);
    if (header == std::string_view::npos) {
        return std::nullopt;
    }
    const size_t number = header + kLength.size();
    const size_t lineEnd = text.find("\r\n", number);
    if (lineEnd == std::string_view::npos) {
        return std::nullopt;
    }
    const size_t blank = text.find("\r\n\r\n", number);
    if (blank == std::string_view::npos) {
        return std::nullopt;
    }
    return EchoReport{blank + 4, ParseDecimal(text.substr(number, lineEnd - number))};
}

std::string_view AsText(const char* data, size_t length) {
    const void* zero = std::memchr(data, 0, length);
    return {data,
            zero != nullptr ? static_cast<size_t>(static_cast<const char*>(zero) - data) : length};
}

}  // namespace diagnostics
