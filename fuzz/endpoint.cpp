// The endpoint and list texts: SplitHostPort of the proxy, GetListToken of the STUN server list,
// and the HOST[:PORT] options of nqpm. Byte 0 picks the token, byte 1 the buffer's capacity.
#include <algorithm>
#include <vector>

#include "fuzz/FuzzSupport.h"
#include "sipproxy/SipText.h"
#include "stun/STUNResults.h"
#include "tools/nqpm/Cli.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size < 2) {
        return 0;
    }
    const int index = data[0] % 16;
    const size_t capacity = data[1] % 64;
    const std::string text(reinterpret_cast<const char*>(data) + 2, size - 2);

    const sipproxy::HostPort split = sipproxy::SplitHostPort(text);
    const size_t colon = text.find(':');
    FUZZ_CHECK(split.host == text.substr(0, colon));
    FUZZ_CHECK(colon != std::string::npos || split.port == sipproxy::kDefaultSipPort);

    // An exact-size buffer, so that a write past its end shows.
    std::vector<char> buffer(capacity);
    const bool ok = stun::GetListToken(text.c_str(), index, buffer.data(), capacity);
    FUZZ_CHECK(ok == (capacity != 0));
    if (ok) {
        const auto length =
            static_cast<size_t>(std::find(buffer.begin(), buffer.end(), '\0') - buffer.begin());
        FUZZ_CHECK(length < capacity);
        const std::string token(buffer.data(), length);
        FUZZ_CHECK(token.find(',') == std::string::npos && text.find(token) != std::string::npos);
    }

    try {
        const nqpm::HostPort hp = nqpm::ParseHostPort("stun", text, 3478);
        FUZZ_CHECK(!hp.host.empty() && hp.port != 0);
        const size_t last = text.rfind(':');
        FUZZ_CHECK(hp.host == text.substr(0, last));
        FUZZ_CHECK(last != std::string::npos || hp.port == 3478);
    } catch (const nqpm::UsageError&) {
    }
    return 0;
}
