// Small IPv4 routines shared by everything above: name resolution, UDP sockets on a chosen or a
// rotating port, single datagrams with a timeout, and the host's UDP receive counter.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string>

#include "platform/net.h"
#include "platform/netinfo.h"

namespace foundation {

using platform::kInvalidSocket;
using platform::Socket;
using platform::SocketHandle;

inline constexpr uint32_t kAddressNone = 0xFFFFFFFFu;

// Dotted quad or host name to a network-order address. A dotted quad needs no look-up. A name
// nobody knows gives notFoundValue without a log line (0 for the keep-alive refresh,
// kAddressNone for the SIP socket and proxy); any other resolver failure logs at ERROR and
// gives 0.
uint32_t GetIPByName(const std::string& name, uint32_t notFoundValue = 0);

// The candidates for sockets that do not ask for a port: one sequence through 10000..60000,
// wrapping to 10000, that starts at a random port unless given a start. Safe from any thread.
class RotatingPort {
  public:
    // next 0: a random start on first use.
    explicit RotatingPort(uint16_t next = 0) : m_next(next) {}
    RotatingPort(const RotatingPort&) = delete;
    RotatingPort& operator=(const RotatingPort&) = delete;

    // The sequence every socket of the process shares by default.
    static RotatingPort& Shared();

    // Hands out the next candidate and advances the sequence.
    uint16_t Take();
    // The next candidate without taking it (0 until first use).
    uint16_t Next() const { return m_next.load(); }

  private:
    // Atomic so that two callers never race on the value itself (they may still both try a
    // port, and one bind then fails, which costs one attempt).
    std::atomic<uint16_t> m_next;
};

// Binds a new UDP socket on localAddress (host order, 0 for any). port absent or 0 takes the
// next candidate of ports; a present 0 receives the bound port. A non-zero port binds exactly
// that port or fails. The socket is invalid on failure.
Socket CreateUdpSocket(uint32_t localAddress, uint16_t* port,
                       RotatingPort& ports = RotatingPort::Shared());

// sendto result: bytes sent or the socket error value.
int SendDatagram(SocketHandle s, const void* data, size_t length, uint32_t address, uint16_t port);

// Waits up to timeoutMs (-1: no limit) for one datagram. Returns the byte count (sender written
// in host order), 0 on timeout, or the socket error value; out values untouched unless bytes
// were received. A datagram longer than the buffer is an error, and so is a stop request of the
// calling thread's owner.
int ReceiveDatagram(SocketHandle s, void* buffer, size_t capacity, uint32_t* fromAddress,
                    uint16_t* fromPort, int timeoutMs);

// The host-wide count of UDP datagrams received. Returns 0 (S_OK) or 0x80070000 | error.
int32_t QueryUdpInDatagrams(uint32_t* count,
                            platform::NetworkInfo& info = platform::SystemNetworkInfo());

// Adapter queries: an adapter is an interface, its first IPv4 address is its primary address
// and its gateway is the gateway of a default route through it.
bool GetInterfaceAddressAndGateway(uint32_t interfaceIndex, std::string& address,
                                   std::string& gateway,
                                   platform::NetworkInfo& info = platform::SystemNetworkInfo());
std::string GetGatewayForLocalAddress(const std::string& address,
                                      platform::NetworkInfo& info = platform::SystemNetworkInfo());

// Dotted text of a host-order address.
std::string FormatHostAddress(uint32_t hostAddress);

}  // namespace foundation
