// The shared endpoint type: an address text (dotted quad or host name) and a port.
#pragma once

#include <cstdint>
#include <string>

namespace foundation {

struct NetworkEndpoint {
    std::string m_address;
    int32_t m_port = 0;

    NetworkEndpoint() = default;
    NetworkEndpoint(std::string address, int32_t port)
        : m_address(std::move(address)), m_port(port) {}

    // "m_address= <address>, m_port=<port>", as the log lines show it.
    std::string ToString() const;

    bool operator==(const NetworkEndpoint&) const = default;
};

}  // namespace foundation
