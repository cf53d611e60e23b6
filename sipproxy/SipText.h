// Byte-level text operations on SIP datagrams: exact, case-sensitive searches over the message
// as it came off the wire. No SIP parsing: the rewrites only replace known address texts.
#pragma once

#include <cstdint>
#include <string>

namespace sipproxy {

inline constexpr const char* kHeaderEnd = "\r\n\r\n";
inline constexpr int32_t kDefaultSipPort = 5060;

// Every occurrence of pattern replaced, left to right; inserted text is never searched again.
// An empty pattern leaves the text as it is.
std::string ReplaceAll(const std::string& text, const std::string& pattern,
                       const std::string& replacement);

// ReplaceAll over the part before the first CR LF CR LF; the rest, body included, stays. A text
// without one is written to the debugger output and then replaced over its whole length.
std::string ReplaceInHeaders(const std::string& text, const std::string& pattern,
                             const std::string& replacement);

// Replaces the pattern where it stands as a bare host: not at the very start, not followed by
// ":" or ";dstport", not right after "=", not at the end of the text, and not in a Call-ID
// header (an opaque word such as 1-42@198.51.100.20, which the dialog is matched by).
std::string ReplaceBareHost(const std::string& text, const std::string& pattern,
                            const std::string& replacement);

struct HostPort {
    std::string host;
    int32_t port = kDefaultSipPort;
};
// Split at the first ":"; the port is read like atoi (saturating, so hostile digits cannot
// overflow). Without a colon the port is 5060.
HostPort SplitHostPort(const std::string& text);

bool IsRegister(const std::string& message);

// When the body of rewritten (after its first CR LF CR LF) is no longer as long as the body of
// original, every Content-Length (or "l") header of rewritten is set to the new length, so that
// a receiver that trusts it neither cuts the body nor drops the message. Otherwise rewritten
// comes back byte for byte.
std::string CorrectContentLength(const std::string& original, const std::string& rewritten);

}  // namespace sipproxy
