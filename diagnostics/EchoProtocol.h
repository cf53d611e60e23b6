// The echo server protocol without I/O: the login request and the checks of its reply, the test
// messages, and the parsing of the server's echo reports. The drivers own the sockets.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace diagnostics {

inline constexpr std::string_view kEchoLoginRequest = "Method: Login\r\nSIP-Mode: Echo\r\n";
static_assert(kEchoLoginRequest.size() == 31);

inline constexpr size_t kEchoBufferSize = 4096;
inline constexpr size_t kMediaPayloadSize = 1398;

// What the login reply tells; ports as the server gave them, cut to 16 bits.
struct EchoLogin {
    std::string m_sessionId;  // as received, a leading blank included
    uint16_t m_sipPort = 0;
    uint16_t m_audioRtpPort = 0;
    uint16_t m_audioRtcpPort = 0;
    uint16_t m_videoRtpPort = 0;
    uint16_t m_videoRtcpPort = 0;
};

// The value of "name:" anywhere in the text (case-sensitive), up to the next CR LF or the end.
std::optional<std::string_view> HeaderValue(std::string_view text, std::string_view name);
// atol: leading blanks, a sign, digits up to the first non-digit; saturates instead of
// overflowing.
long ParseDecimal(std::string_view text);

// 0, or the code of the first header check that fails (17 to 24).
int32_t ParseLoginReply(std::string_view text, EchoLogin& login);

// The four SIP samples, each with the same fixed Call-ID.
inline constexpr std::string_view kSampleCallId = "6f1c9e2a4b7d08e35a92c4f1d0b8e7a3";
std::string_view SipRegisterRequest();
std::string_view SipRegisterResponse();
std::string_view SipInviteRequest();
std::string_view SipInviteResponse();

// The first occurrence of the fixed Call-ID replaced by the session id; unchanged without one.
std::string WithSessionId(std::string_view sample, std::string_view sessionId);

// kMediaPayloadSize bytes: "Call-ID: <session id>\r\n", then byte (position | 1) mod 256 up to
// the end. A line that does not fit is cut at the payload's end, so the size never changes.
std::string MakeMediaPayload(std::string_view sessionId);

// Where an echo report's payload starts, and how long the report says it is.
struct EchoReport {
    size_t m_payloadOffset = 0;
    long m_length = 0;
};
// "Content-Length: " n CR LF, then the first "\r\n\r\n" after n. Empty when any is missing.
std::optional<EchoReport> ParseEchoReport(std::string_view text);

// A received buffer seen as text: up to the first zero byte.
std::string_view AsText(const char* data, size_t length);

}  // namespace diagnostics
