// A datagram from the echo server: its login reply and its echo reports.
#include <string_view>

#include "diagnostics/EchoProtocol.h"
#include "fuzz/FuzzSupport.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string_view raw(reinterpret_cast<const char*>(data), size);
    const std::string_view text = diagnostics::AsText(raw.data(), raw.size());
    FUZZ_CHECK(text.size() <= size && text.find('\0') == std::string_view::npos);

    for (const std::string_view t : {raw, text}) {
        diagnostics::EchoLogin login;
        const int32_t code = diagnostics::ParseLoginReply(t, login);
        FUZZ_CHECK(code == 0 || (code >= 17 && code <= 24));
        if (code == 0) {
            FUZZ_CHECK(t.find(login.m_sessionId) != std::string_view::npos);
            FUZZ_CHECK(login.m_sessionId.find("\r\n") == std::string::npos);
        }
        if (const auto report = diagnostics::ParseEchoReport(t)) {
            FUZZ_CHECK(report->m_payloadOffset >= 4 && report->m_payloadOffset <= t.size());
            FUZZ_CHECK(t.substr(report->m_payloadOffset - 4, 4) == "\r\n\r\n");
        }
    }
    return 0;
}
