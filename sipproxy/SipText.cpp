#include "sipproxy/SipText.h"

#include <climits>

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

// A Call-ID is an opaque word that often ends in "@host"; changing it breaks the dialog.
bool InCallIdHeader(const std::string& text, size_t at) {
    const size_t previous = at < 2 ? std::string::npos : text.rfind("\r\n", at - 2);
    const size_t lineStart = previous == std::string::npos ? 0 : previous + 2;
    const size_t colon = text.find(':', lineStart);
    return colon != std::string::npos && colon < at &&
           (IsHeaderName(text, lineStart, colon, "call-id") ||
            IsHeaderName(text, lineStart, colon, "i"));
}
}  // namespace

std::string ReplaceBareHost(const std::string& text, const std::string& pattern,
                            const std::string& replacement) {
    if (pattern.empty()) {
        return text;
    }
    std::string work = text;
    size_t start = 0;
    for (;;) {
        const size_t at = work.find(pattern, start);
        if (at == std::string::npos) {
            break;
        }
        const size_t after = at + pattern.size();
        if (after >= work.size()) {
            break;
        }
        const bool keep = work[after] == ':' || work.compare(after, 8, ";dstport") == 0 ||
                          at <= 1 || work[at - 1] == '=' || InCallIdHeader(work, at);
        if (keep) {
            start = after;
            continue;
        }
        work.replace(at, pattern.size(), replacement);
        start = at + replacement.size();
    }
    return work;
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
        const size_t colon = rewritten.find(':', lineStart);
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
