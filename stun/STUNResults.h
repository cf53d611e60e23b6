// The outcome of classifying one local address, the list the result service keeps, and their
// text forms.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace stun {

// Numbered like the STUN members of the port manager's topology.
enum STUN_RESULT : uint8_t {
    STUN_RESULT_UNKNOWN = 0,
    STUN_RESULT_OPEN = 1,
    STUN_RESULT_FULL_CONE_FIREWALL = 2,
    STUN_RESULT_FULL_CONE_NAT = 3,
    STUN_RESULT_RESTRICTED_CONE_NAT = 4,
    STUN_RESULT_PORT_RESTRICTED_CONE_NAT = 5,
    STUN_RESULT_SYMMETRIC_FIREWALL = 6,
    STUN_RESULT_SYMMETRIC_NAT = 7,
    STUN_RESULT_BLOCKED = 8,
};

inline constexpr uint32_t kNoPublicAddress = 0xFFFFFFFFu;
inline constexpr size_t kMaxSTUNResults = 10;

struct STUNResultEntry {
    uint32_t localAddress = 0;  // host order
    uint8_t stunResult = STUN_RESULT_UNKNOWN;
    uint32_t publicAddress = kNoPublicAddress;  // host order
};

struct STUNResultList {
    int32_t count = 0;
    STUNResultEntry entries[kMaxSTUNResults];
};

// "STUN_RESULT_FULL_CONE_NAT" and so on; null for a value outside the enumeration.
const char* STUNResultName(uint8_t result);

// Dotted quad of a host-order address, most significant byte first.
std::string FormatHostOrderAddress(uint32_t hostAddress);

// One text for the first count entries (at most the entries that exist).
std::string FormatSTUNResults(const STUNResultList& list);

// Copies token `index` (0-based) of a comma-separated list into buffer, cut to capacity - 1
// characters. Empty tokens do not count and blanks are kept, as strtok splits; a missing token
// gives an empty string and still true. False only for a missing list or buffer or capacity 0.
bool GetListToken(const char* list, int index, char* buffer, size_t capacity);

}  // namespace stun
