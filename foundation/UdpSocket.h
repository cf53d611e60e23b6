// One UDP socket and its local port, as the local SIP proxy uses it. Texts are UTF-8; the COM
// boundary converts.
#pragma once

#include <cstdint>
#include <string>

#include "foundation/NetUtils.h"

namespace foundation {

class UdpSocket {
  public:
    UdpSocket() = default;
    UdpSocket(const UdpSocket&) = delete;
    UdpSocket& operator=(const UdpSocket&) = delete;

    // Any local address, the object's port (0: a rotating one, remembered).
    bool Open();
    // The dotted-quad local address (no name look-up), the object's port. The range and the
    // randomise flag come from the proxy's start and do not limit the choice.
    bool Open(const std::string& localAddress, int32_t minPort, int32_t maxPort, bool randomize);
    // Sets the object's port first, then as above.
    bool Open(const std::string& localAddress, uint16_t port);

    bool IsValid() const { return m_socket.IsValid(); }
    SocketHandle Handle() const { return m_socket.Get(); }
    uint16_t LocalPort() const { return m_port; }
    // Bound address in host order; kAddressNone when closed.
    uint32_t LocalAddress() const;
    // Bound address as dotted text; empty when closed.
    std::string LocalAddressText() const;
    // "address:port" of the bound socket.
    std::string LocalEndpointText() const;

    // Waits without limit for one datagram (4096 bytes at most). Empty on a closed socket or a
    // failed receive, with the out values untouched; zero bytes inside stay.
    std::string Receive(std::string& fromAddress, uint16_t& fromPort);
    // Waits without limit for one datagram (4096 bytes at most) and says what came: the byte
    // count (0 for an empty datagram, the sender written in host order), or kSocketError with
    // platform::LastSocketError() telling why (kErrMessageSize: longer than the buffer, and
    // consumed; kErrInterrupted: the calling thread's owner asked it to stop).
    int Receive(std::string& data, uint32_t& fromHostAddress, uint16_t& fromPort);
    // True only if the whole string was sent.
    bool SendTo(const std::string& data, uint32_t hostAddress, uint16_t port);
    // Resolves with the variant whose "not found" value is kAddressNone.
    bool SendTo(const std::string& data, const std::string& hostName, uint16_t port);
    void Close();

  private:
    bool OpenOn(uint32_t hostAddress);

    Socket m_socket;
    uint16_t m_port = 0;
};

}  // namespace foundation
