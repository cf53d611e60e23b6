#include "foundation/NetUtils.h"

#include <cstdlib>
#include <vector>

#include "foundation/Logger.h"
#include "platform/kernel.h"

namespace foundation {

namespace {
constexpr uint16_t kFirstRotatingPort = 10000;
constexpr uint16_t kLastRotatingPort = 60000;
constexpr int kRotatingBindAttempts = 100;
}  // namespace

RotatingPort& RotatingPort::Shared() {
    static RotatingPort ports;
    return ports;
}

uint16_t RotatingPort::Take() {
    uint16_t current = m_next.load();
    for (;;) {
        uint16_t candidate = current;
        if (candidate == 0) {
            std::srand(platform::GetTickCount());
            candidate = static_cast<uint16_t>(kFirstRotatingPort + std::rand() % 50001);
        }
        const uint16_t next = candidate >= kLastRotatingPort ? kFirstRotatingPort
                                                             : static_cast<uint16_t>(candidate + 1);
        if (m_next.compare_exchange_weak(current, next)) {
            return candidate;
        }
    }
}

uint32_t GetIPByName(const std::string& name, uint32_t notFoundValue) {
    const uint32_t dotted = platform::InetAddrNet(name);
    if (dotted != platform::kInaddrNone) {
        return dotted;
    }
    uint32_t address = 0;
    const int error = platform::ResolveHostNameNet(name, &address);
    if (error == 0) {
        return address;
    }
    if (error == platform::kErrHostNotFound) {
        return notFoundValue;
    }
    NQ_LOG("GetIPByName", kLogError, "%s", "Failed Assertion - dwError == WSAHOST_NOT_FOUND");
    return 0;
}

Socket CreateUdpSocket(uint32_t localAddress, uint16_t* port, RotatingPort& ports) {
    Socket s = platform::OpenUdpSocket();
    if (!s) {
        return s;
    }
    if (port != nullptr && *port != 0) {
        if (!platform::BindSocket(s.Get(), localAddress, *port)) {
            s.Close();
        }
        return s;
    }
    for (int attempt = 0; attempt < kRotatingBindAttempts; ++attempt) {
        const uint16_t candidate = ports.Take();
        if (platform::BindSocket(s.Get(), localAddress, candidate)) {
            if (port != nullptr) {
                *port = candidate;
            }
            return s;
        }
    }
    s.Close();
    return s;
}

int SendDatagram(SocketHandle s, const void* data, size_t length, uint32_t address, uint16_t port) {
    return platform::SendTo(s, data, length, address, port);
}

int ReceiveDatagram(SocketHandle s, void* buffer, size_t capacity, uint32_t* fromAddress,
                    uint16_t* fromPort, int timeoutMs) {
    const int ready = platform::WaitSocketReadable(s, timeoutMs);
    if (ready != 1) {
        return ready;
    }
    uint32_t address = 0;
    uint16_t port = 0;
    const int n = platform::ReceiveFrom(s, buffer, capacity, &address, &port);
    if (n < 1) {
        return n;
    }
    if (fromAddress != nullptr) {
        *fromAddress = address;
    }
    if (fromPort != nullptr) {
        *fromPort = port;
    }
    return n;
}

int32_t QueryUdpInDatagrams(uint32_t* count, platform::NetworkInfo& info) {
    uint32_t value = 0;
    const int error = info.UdpInDatagrams(value);
    if (error != 0) {
        return static_cast<int32_t>(0x80070000u | (static_cast<uint32_t>(error) & 0xFFFFu));
    }
    *count = value;
    return 0;
}

bool GetInterfaceAddressAndGateway(uint32_t interfaceIndex, std::string& address,
                                   std::string& gateway, platform::NetworkInfo& info) {
    std::vector<platform::AdapterInfo> adapters;
    if (!info.Adapters(adapters)) {
        return false;
    }
    for (const auto& a : adapters) {
        if (!a.gateway.empty() && a.index == interfaceIndex) {
            gateway = a.gateway;
            address = a.addresses.empty() ? std::string() : a.addresses.front();
            return true;
        }
    }
    return false;
}

std::string GetGatewayForLocalAddress(const std::string& address, platform::NetworkInfo& info) {
    std::vector<platform::AdapterInfo> adapters;
    if (!info.Adapters(adapters)) {
        return {};
    }
    for (const auto& a : adapters) {
        if (!a.gateway.empty() && !a.addresses.empty() && a.addresses.front() == address) {
            return a.gateway;
        }
    }
    return {};
}

std::string FormatHostAddress(uint32_t hostAddress) {
    return platform::InetNtoaNet(platform::HostToNet32(hostAddress));
}

}  // namespace foundation
