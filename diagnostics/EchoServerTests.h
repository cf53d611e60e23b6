// The last stage of a diagnostic run: a TCP login to the echo server, then SIP and media
// datagrams whose UDP echoes and TCP reports are compared with what was sent.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "diagnostics/DiagnosticResult.h"
#include "platform/net.h"

namespace diagnostics {

// Waits until the socket is readable (or fails), at most timeoutMs, then one receive of at most
// length bytes. 0 when the time ran out, -1 when the wait failed (the owner's stop included),
// else the receive's result.
int RecvWithTimeout(platform::SocketHandle s, char* buffer, size_t length, uint32_t timeoutMs);

// Destination of an exchange, host order.
struct EchoDestination {
    uint32_t m_address = 0;
    uint16_t m_port = 0;
};

// One datagram to the server, its UDP echo and its TCP report, recorded as testType.
void RunEchoExchange(DiagnosticResult& result, int32_t testType, platform::SocketHandle control,
                     platform::SocketHandle udp, EchoDestination destination,
                     std::string_view message, uint32_t timeoutMs);

// localAddressNet: the interface address in network order. Records every outcome in result.
void RunEchoServerTests(uint32_t localAddressNet, const std::string& echoServer, uint16_t echoPort,
                        uint32_t timeoutMs, DiagnosticResult& result);

}  // namespace diagnostics
