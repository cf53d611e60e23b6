#include "sipproxy/SipText.h"

#include <algorithm>
#include <climits>
#include <cstddef>

#include "platform/kernel.h"

namespace sipproxy {

std::string ReplaceAll(const std::string& text, const std::string& pattern,
                       const std::string& replacement) {
    if (pattern.empty()) {
        return text;
    }
    std::string out;
    out.reserve(text.size());
    size_t from = 0;
    for (size_t at = text.find(pattern); at != std::string::npos; at = text.find(pattern, from)) {
        out.append(text, from, at - from);
        out += replacement;
        from = at + pattern.size();
    }
    out.append(text, from, std::string::npos);
    return out;
}

std::string ReplaceInHeaders(const std::string& text, const std::string& pattern,
                             const std::string& replacement) {
    const size_t end = text.find(kHeaderEnd);
    if (end == std::string::npos) {
        platform::OutputDebugString(text);
        return ReplaceAll(text, pattern, replacement);
    }
    return ReplaceAll(text.substr(0, end), pattern, replacement) + text.substr(end);
}

namespace {
bool IsLineSpace(char c) {
    return c == ' ' || c == '\t';
}

// Whether text[begin, end) is the header name `name` (lower case), blanks before the colon
// allowed.
bool IsHeaderName(const std::string& text, size_t begin, size_t end, const std::string& name) {
    while (end > begin && IsLineSpace(text[end - 1])) {
        --end;
    }
    if (end - begin != name.size()) {
        return false;
    }
    for (size_t i = 0; i < name.size(); ++i) {
        char c = text[begin + i];
        if (c >= 'A' && c <= 'Z') {
            c = static_cast<char>(c - 'A' + 'a');
        }
        if (c != name[i]) {
            return false;
        }
    }
    return true;
}

// The line of a match, as the matches are met left to right: each CR LF and the first colon of a
// line are looked for once, so that a hostile datagram of many matches on one long line costs one
// pass, not one pass a match.
class LineOfMatch {
  public:
    explicit LineOfMatch(const std::string& text) : text_(text), nextBreak_(text.find("\r\n")) {}

    // A Call-ID is an opaque word that often ends in "@host"; changing it breaks the dialog.
    bool InCallIdHeader(size_t at) {
        // A line starts after a CR LF that ends at or before the match.
        while (nextBreak_ != std::string::npos && nextBreak_ + 2 <= at) {
            lineStart_ = nextBreak_ + 2;
            nextBreak_ = text_.find("\r\n", lineStart_);
            known_ = false;
        }
        if (!known_) {
            if (!noColonLeft_ && (colon_ == std::string::npos || colon_ < lineStart_)) {
                colon_ = text_.find(':', lineStart_);
                noColonLeft_ = colon_ == std::string::npos;
            }
            callId_ = colon_ != std::string::npos &&
                      (IsHeaderName(text_, lineStart_, colon_, "call-id") ||
                       IsHeaderName(text_, lineStart_, colon_, "i"));
            known_ = true;
        }
        return callId_ && colon_ < at;
    }

  private:
    const std::string& text_;
    size_t nextBreak_;
    size_t lineStart_ = 0;
    size_t colon_ = std::string::npos;  // the first colon at or after lineStart_
    bool noColonLeft_ = false;
    bool known_ = false;
    bool callId_ = false;
};
}  // namespace

std::string ReplaceBareHost(const std::string& text, const std::string& pattern,
                            const std::string& replacement) {
    if (pattern.empty()) {
        return text;
    }
    // Built once, left to right, each match judged by the text as it came: a copy edited in place
    // costs a move of the rest for every match.
    std::string out;
    out.reserve(text.size());
    LineOfMatch line(text);
    size_t from = 0;
    for (size_t at = text.find(pattern); at != std::string::npos;
         at = text.find(pattern, at + pattern.size())) {
        const size_t after = at + pattern.size();
        if (after >= text.size()) {
            break;
        }
        const bool keep = text[after] == ':' || text.compare(after, 8, ";dstport") == 0 ||
                          at <= 1 || text[at - 1] == '=' || line.InCallIdHeader(at);
        if (!keep) {
            out.append(text, from, at - from);
            out += replacement;
            from = after;
        }
    }
    out.append(text, from, std::string::npos);
    return out;
}

namespace {
int32_t SaturatingAtoi(const std::string& text) {
    size_t i = 0;
    while (i < text.size() && (text[i] == ' ' || (text[i] >= '\t' && text[i] <= '\r'))) {
        ++i;
    }
    bool negative = false;
    if (i < text.size() && (text[i] == '+' || text[i] == '-')) {
        negative = text[i] == '-';
        ++i;
    }
    int64_t value = 0;
    for (; i < text.size() && text[i] >= '0' && text[i] <= '9'; ++i) {
        value = value * 10 + (text[i] - '0');
        if (value > INT32_MAX) {
            return negative ? INT32_MIN : INT32_MAX;
        }
    }
    return static_cast<int32_t>(negative ? -value : value);
}

bool IsContentLengthName(const std::string& text, size_t begin, size_t end) {
    return IsHeaderName(text, begin, end, "content-length") || IsHeaderName(text, begin, end, "l");
}
}  // namespace

HostPort SplitHostPort(const std::string& text) {
    const size_t colon = text.find(':');
    if (colon == std::string::npos) {
        return HostPort{text, kDefaultSipPort};
    }
    return HostPort{text.substr(0, colon), SaturatingAtoi(text.substr(colon + 1))};
}

bool IsRegister(const std::string& message) {
    return message.size() >= 8 && message.compare(0, 8, "REGISTER") == 0;
}

std::string CorrectContentLength(const std::string& original, const std::string& rewritten) {
    const size_t originalEnd = original.find(kHeaderEnd);
    const size_t end = rewritten.find(kHeaderEnd);
    if (originalEnd == std::string::npos || end == std::string::npos) {
        return rewritten;
    }
    const size_t originalBody = original.size() - originalEnd - 4;
    const size_t body = rewritten.size() - end - 4;
    if (body == originalBody) {
        return rewritten;
    }
    const std::string value = std::to_string(body);
    std::string out;
    out.reserve(rewritten.size() + 8);
    // Header lines: the start line cannot be Content-Length, so only lines after a CR LF count.
    size_t lineStart = 0;
    while (lineStart < end) {
        size_t lineEnd = rewritten.find("\r\n", lineStart);
        if (lineEnd == std::string::npos || lineEnd > end) {
            lineEnd = end;
        }
        // Within the line: a search to the end of the text for every line would go quadratic.
        const size_t colon = static_cast<size_t>(
            std::find(rewritten.begin() + static_cast<std::ptrdiff_t>(lineStart),
                      rewritten.begin() + static_cast<std::ptrdiff_t>(lineEnd), ':') -
            rewritten.begin());
        if (lineStart > 0 && colon < lineEnd && IsContentLengthName(rewritten, lineStart, colon)) {
            size_t valueStart = colon + 1;
            while (valueStart < lineEnd && IsLineSpace(rewritten[valueStart])) {
                ++valueStart;
            }
            out.append(rewritten, lineStart, valueStart - lineStart);
            out += value;
        } else {
            out.append(rewritten, lineStart, lineEnd - lineStart);
        }
        if (lineEnd < end) {
            out += "\r\n";
        }
        lineStart = lineEnd + 2;
    }
    out.append(rewritten, end, std::string::npos);
    return out;
}

}  // namespace sipproxy
