// Helpers of the port mapping tests: log capture, loopback sockets that close themselves, and a
// window of free loopback ports.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <deque>
#include <mutex>
#include <optional>
#include <random>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/Logger.h"
#include "platform/kernel.h"
#include "platform/net.h"
#include "portmanager/PortMappingPool.h"
#include "tests/support/LogCapture.h"

namespace portmanager::testing {

inline constexpr const char* kLoopback = "127.0.0.1";
inline constexpr uint32_t kLoopbackHost = 0x7F000001;

using testsupport::LogCapture;
using testsupport::LogLine;

// A loopback UDP socket that closes itself: a listener on an arbitrary port, or the client's
// own socket on a chosen one (with or without SO_REUSEADDR set before the bind).
class LoopbackSocket {
  public:
    explicit LoopbackSocket(uint16_t port = 0, bool reuse = false)
        : m_handle(platform::OpenUdpSocket()) {
        if (m_handle == platform::kInvalidSocket ||
            (reuse && !platform::SetReuseAddress(m_handle, true)) ||
            !platform::BindSocket(m_handle, kLoopbackHost, port) ||
            !platform::GetSocketName(m_handle, nullptr, &m_port)) {
            Close();
        }
    }
    ~LoopbackSocket() { Close(); }
    LoopbackSocket(const LoopbackSocket&) = delete;
    LoopbackSocket& operator=(const LoopbackSocket&) = delete;

    bool IsBound() const { return m_handle != platform::kInvalidSocket; }
    uint16_t Port() const { return m_port; }
    void Close() {
        platform::CloseSocket(m_handle);
        m_handle = platform::kInvalidSocket;
    }

    struct Datagram {
        std::vector<uint8_t> bytes;
        uint32_t fromAddress = 0;
        uint16_t fromPort = 0;
    };
    // The next datagram; empty when none arrives in time. Only a safety net against a hang:
    // the tests send a datagram they expect before they look, so they never wait for silence.
    std::optional<Datagram> Receive(int timeoutMs = 2000) {
        if (platform::WaitSocketReadable(m_handle, timeoutMs) != 1) {
            return std::nullopt;
        }
        Datagram d;
        d.bytes.resize(2048);
        const int n = platform::ReceiveFrom(m_handle, d.bytes.data(), d.bytes.size(),
                                            &d.fromAddress, &d.fromPort);
        if (n < 0) {
            return std::nullopt;
        }
        d.bytes.resize(static_cast<size_t>(n));
        return d;
    }

  private:
    platform::SocketHandle m_handle;
    uint16_t m_port = 0;
};

// A pool that closes its free list when the test ends, however it ends.
struct ScopedPool : PortMappingPool {
    ~ScopedPool() { CloseFree(); }
};

// The private ports of the free list, front to back, relative to a base port.
inline std::vector<int32_t> FreeOffsets(const PortMappingPool& pool, int32_t base) {
    std::vector<int32_t> offsets;
    for (const MappedServiceEndpoint& mapping : pool.Free()) {
        offsets.push_back(mapping.m_private.m_port - base);
    }
    return offsets;
}

// An even base port whose window [base, base + size) is free on loopback right now, below the
// ephemeral range so that no socket bound to port 0 lands in it. Bases are drawn at random so
// that test processes running side by side rarely probe the same window.
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
