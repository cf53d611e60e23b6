// Helpers of the port mapping tests: loopback sockets that close themselves, pools that close
// their placeholders, and windows of free loopback ports.
#pragma once

#include <cstdint>
#include <deque>
#include <optional>
#include <random>
#include <vector>

#include "platform/kernel.h"
#include "platform/net.h"
#include "portmanager/PortMappingPool.h"
#include "tests/support/LogCapture.h"

namespace portmanager::testing {

inline constexpr const char* kLoopback = "127.0.0.1";
inline constexpr uint32_t kLoopbackHost = 0x7F000001;

using testsupport::LogCapture;

// A loopback UDP socket on `port` (0: any), optionally with SO_REUSEADDR set before the bind.
class LoopbackSocket {
  public:
    explicit LoopbackSocket(uint16_t port = 0, bool reuse = false)
        : m_handle(platform::OpenUdpSocket()) {
        if (!m_handle || (reuse && !platform::SetReuseAddress(m_handle.Get(), true)) ||
            !platform::BindSocket(m_handle.Get(), kLoopbackHost, port) ||
            !platform::GetSocketName(m_handle.Get(), nullptr, &m_port)) {
            Close();
        }
    }

    bool IsBound() const { return m_handle.IsValid(); }
    uint16_t Port() const { return m_port; }
    platform::SocketHandle Handle() const { return m_handle.Get(); }
    void Close() { m_handle.Close(); }

    struct Datagram {
        std::vector<uint8_t> bytes;
        uint32_t fromAddress = 0;
        uint16_t fromPort = 0;
    };
    // The timeout only guards against a hang: tests look only for datagrams they expect.
    std::optional<Datagram> Receive(int timeoutMs = 2000) {
        if (platform::WaitSocketReadable(m_handle.Get(), timeoutMs) != 1) {
            return std::nullopt;
        }
        Datagram d;
        d.bytes.resize(2048);
        const int n = platform::ReceiveFrom(m_handle.Get(), d.bytes.data(), d.bytes.size(),
                                            &d.fromAddress, &d.fromPort);
        if (n < 0) {
            return std::nullopt;
        }
        d.bytes.resize(static_cast<size_t>(n));
        return d;
    }

  private:
    platform::Socket m_handle;
    uint16_t m_port = 0;
};

// Whether something holds the port, so that a socket without SO_REUSEADDR cannot bind it.
inline bool IsHeld(int32_t port) {
    return !LoopbackSocket(static_cast<uint16_t>(port)).IsBound();
}

struct ScopedPool : PortMappingPool {
    ~ScopedPool() { CloseFree(); }
};

// The private ports of the free list, front to back, relative to `base`.
inline std::vector<int32_t> FreeOffsets(const PortMappingPool& pool, int32_t base) {
    std::vector<int32_t> offsets;
    for (const MappedServiceEndpoint& mapping : pool.Free()) {
        offsets.push_back(mapping.m_private.m_port - base);
    }
    return offsets;
}

// An even base whose [base, base + size) is free now, below the ephemeral range so that no
// port-0 bind lands in it; random so that parallel test processes rarely collide.
inline std::optional<int32_t> FindFreeWindow(int32_t size) {
    std::mt19937 generator{std::random_device{}()};
    std::uniform_int_distribution<int32_t> slot(0, 5000);
    for (int attempt = 0; attempt < 50; ++attempt) {
        const int32_t base = 20000 + 2 * slot(generator);
        bool allFree = true;
        std::deque<LoopbackSocket> probes;
        for (int32_t port = base; port < base + size && allFree; ++port) {
            allFree = probes.emplace_back(static_cast<uint16_t>(port)).IsBound();
        }
        if (allFree) {
            return base;
        }
    }
    return std::nullopt;
}

}  // namespace portmanager::testing
