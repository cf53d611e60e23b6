#include "foundation/UdpSocket.h"

#include <vector>

namespace foundation {

namespace {
constexpr size_t kReceiveBuffer = 4096;
}

bool UdpSocket::OpenOn(uint32_t hostAddress) {
    uint16_t port = m_port;
    Close();
    m_socket = CreateUdpSocket(hostAddress, &port);
    if (!m_socket) {
        return false;
    }
    m_port = port;
    return true;
}

bool UdpSocket::Open() {
    return OpenOn(0);
}

bool UdpSocket::Open(const std::string& localAddress, int32_t, int32_t, bool) {
    return OpenOn(platform::NetToHost32(platform::InetAddrNet(localAddress)));
}

bool UdpSocket::Open(const std::string& localAddress, uint16_t port) {
    m_port = port;
    return OpenOn(platform::NetToHost32(platform::InetAddrNet(localAddress)));
}

uint32_t UdpSocket::LocalAddress() const {
    uint32_t address = kAddressNone;
    if (!m_socket || !platform::GetSocketName(m_socket.Get(), &address, nullptr)) {
        return kAddressNone;
    }
    return address;
}

std::string UdpSocket::LocalAddressText() const {
    if (!m_socket) {
        return {};
    }
    return FormatHostAddress(LocalAddress());
}

std::string UdpSocket::LocalEndpointText() const {
    uint32_t address = 0;
    uint16_t port = 0;
    if (!m_socket || !platform::GetSocketName(m_socket.Get(), &address, &port)) {
        return {};
    }
    return FormatHostAddress(address) + ":" + std::to_string(port);
}

std::string UdpSocket::Receive(std::string& fromAddress, uint16_t& fromPort) {
    if (!m_socket) {
        return {};
    }
    std::vector<char> buffer(kReceiveBuffer);
    uint32_t address = 0;
    uint16_t port = 0;
    const int n =
        ReceiveDatagram(m_socket.Get(), buffer.data(), buffer.size(), &address, &port, -1);
    if (n <= 0) {
        return {};
    }
    fromAddress = FormatHostAddress(address);
    fromPort = port;
    return std::string(buffer.data(), static_cast<size_t>(n));
}

int UdpSocket::Receive(std::string& data, uint32_t& fromHostAddress, uint16_t& fromPort) {
    data.clear();
    if (platform::WaitSocketReadable(m_socket.Get(), -1) != 1) {
        return platform::kSocketError;
    }
    data.resize(kReceiveBuffer);
    const int n = platform::ReceiveFrom(m_socket.Get(), data.data(), data.size(), &fromHostAddress,
                                        &fromPort);
    data.resize(n > 0 ? static_cast<size_t>(n) : 0);
    return n;
}

bool UdpSocket::SendTo(const std::string& data, uint32_t hostAddress, uint16_t port) {
    if (!m_socket) {
        return false;
    }
    const int n = SendDatagram(m_socket.Get(), data.data(), data.size(), hostAddress, port);
    return n >= 0 && static_cast<size_t>(n) == data.size();
}

bool UdpSocket::SendTo(const std::string& data, const std::string& hostName, uint16_t port) {
    if (!m_socket) {
        return false;
    }
    return SendTo(data, platform::NetToHost32(GetIPByName(hostName, kAddressNone)), port);
}

void UdpSocket::Close() {
    if (m_socket) {
        m_socket.Close();
        m_port = 0;
    }
}

}  // namespace foundation
