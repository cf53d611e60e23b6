#include "stun/STUNResults.h"

#include <algorithm>
#include <cstring>

namespace stun {

const char* STUNResultName(uint8_t result) {
    switch (result) {
        case STUN_RESULT_UNKNOWN:
            return "STUN_RESULT_UNKNOWN";
        case STUN_RESULT_OPEN:
            return "STUN_RESULT_OPEN";
        case STUN_RESULT_FULL_CONE_FIREWALL:
            return "STUN_RESULT_FULL_CONE_FIREWALL";
        case STUN_RESULT_FULL_CONE_NAT:
            return "STUN_RESULT_FULL_CONE_NAT";
        case STUN_RESULT_RESTRICTED_CONE_NAT:
            return "STUN_RESULT_RESTRICTED_CONE_NAT";
        case STUN_RESULT_PORT_RESTRICTED_CONE_NAT:
            return "STUN_RESULT_PORT_RESTRICTED_CONE_NAT";
        case STUN_RESULT_SYMMETRIC_FIREWALL:
            return "STUN_RESULT_SYMMETRIC_FIREWALL";
        case STUN_RESULT_SYMMETRIC_NAT:
            return "STUN_RESULT_SYMMETRIC_NAT";
        case STUN_RESULT_BLOCKED:
            return "STUN_RESULT_BLOCKED";
        default:
            return nullptr;
    }
}

std::string FormatHostOrderAddress(uint32_t a) {
    return std::to_string(a >> 24) + "." + std::to_string((a >> 16) & 0xFF) + "." +
           std::to_string((a >> 8) & 0xFF) + "." + std::to_string(a & 0xFF);
}

std::string FormatSTUNResults(const STUNResultList& list) {
    std::string text;
    const int32_t count = std::clamp<int32_t>(list.count, 0, kMaxSTUNResults);
    for (int32_t i = 0; i < count; ++i) {
        const STUNResultEntry& e = list.entries[i];
        text += "private IP: ";
        text += FormatHostOrderAddress(e.localAddress);
        switch (e.stunResult) {
            case STUN_RESULT_UNKNOWN:
                text += ", STUN_RESULT_UNKNOWN.";
                break;
            case STUN_RESULT_OPEN:
            case STUN_RESULT_FULL_CONE_FIREWALL:
            case STUN_RESULT_FULL_CONE_NAT:
            case STUN_RESULT_RESTRICTED_CONE_NAT:
            case STUN_RESULT_PORT_RESTRICTED_CONE_NAT:
            case STUN_RESULT_SYMMETRIC_FIREWALL:
                text += ", ";
                text += STUNResultName(e.stunResult);
                text += ": , public IP: ";
                text += FormatHostOrderAddress(e.publicAddress);
                break;
            case STUN_RESULT_SYMMETRIC_NAT:
            case STUN_RESULT_BLOCKED:
                text += ", ";
                text += STUNResultName(e.stunResult);
                text += ": ";
                break;
            default:
                text += ", invalid STUN result!!!: ";
                break;
        }
    }
    return text;
}

bool GetListToken(const char* list, int index, char* buffer, size_t capacity) {
    if (list == nullptr || buffer == nullptr || capacity == 0) {
        return false;
    }
    buffer[0] = '\0';
    int current = 0;
    const char* p = list;
    while (*p != '\0') {
        while (*p == ',') {
            ++p;
        }
        if (*p == '\0') {
            break;
        }
        const char* end = std::strchr(p, ',');
        const size_t length = end != nullptr ? static_cast<size_t>(end - p) : std::strlen(p);
        if (current == index) {
            const size_t copied = std::min(length, capacity - 1);
            std::memcpy(buffer, p, copied);
            buffer[copied] = '\0';
            return true;
        }
        ++current;
        p += length;
    }
    return true;
}

}  // namespace stun
