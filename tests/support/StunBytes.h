// Writing STUN fields byte by byte, independently of the codec under test.
#pragma once

#include <cstdint>
#include <vector>

namespace testsupport {

inline void Put16(std::vector<uint8_t>& out, uint16_t v) {
    out.push_back(static_cast<uint8_t>(v >> 8));
    out.push_back(static_cast<uint8_t>(v));
}

// An IPv4 address attribute (reserved 0, family 1); address in host order.
inline void PutAddress(std::vector<uint8_t>& out, uint16_t type, uint32_t address, uint16_t port) {
    Put16(out, type);
    Put16(out, 8);
    out.push_back(0);
    out.push_back(1);
    Put16(out, port);
    Put16(out, static_cast<uint16_t>(address >> 16));
    Put16(out, static_cast<uint16_t>(address));
}

}  // namespace testsupport
