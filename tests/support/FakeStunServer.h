// A classic STUN responder for the answers no real server gives: silence, a missing
// CHANGED-ADDRESS, a translated mapped port, or an answer to a RESPONSE-ADDRESS sent from the very
// socket the request went to. It listens on one UDP socket on its own thread and counts the
// requests it gets.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <optional>
#include <vector>

#include "platform/kernel.h"
#include "platform/net.h"

namespace testsupport {

inline constexpr uint32_t kLoopback = 0x7F000001;  // 127.0.0.1, host order

class FakeStunServer {
  public:
    enum class Mode {
        kAnswer,            // a Binding Response with MAPPED, SOURCE and CHANGED-ADDRESS
        kSilent,            // count, never answer
        kNoChangedAddress,  // a normal answer without CHANGED-ADDRESS
    };

    // Binds address:port (port 0: the system picks one) and starts answering in kAnswer mode.
    explicit FakeStunServer(uint32_t address = kLoopback, uint16_t port = 0);
    ~FakeStunServer();
    FakeStunServer(const FakeStunServer&) = delete;
    FakeStunServer& operator=(const FakeStunServer&) = delete;

    // False when the socket could not be bound or the thread not started.
    bool IsRunning() const { return running_; }
    uint32_t Address() const { return address_; }
    uint16_t Port() const { return port_; }

    void SetMode(Mode mode);
    // MAPPED-ADDRESS carries this port instead of the sender's (a port-translating NAT).
    void SetMappedPort(std::optional<uint16_t> port);

    int RequestCount() const;
    // Waits until at least count requests have arrived; false on timeout.
    bool WaitForRequests(int count, int timeoutMs) const;

  private:
    void Run();
    // SOURCE-ADDRESS and CHANGED-ADDRESS are both this socket.
    void Answer(const std::vector<uint8_t>& request, uint32_t fromAddress, uint16_t fromPort);

    platform::Socket socket_;
    uint32_t address_ = 0;
    uint16_t port_ = 0;
    bool running_ = false;

    mutable std::mutex mutex_;
    mutable std::condition_variable arrived_;
    Mode mode_ = Mode::kAnswer;
    std::optional<uint16_t> mappedPort_;
    int requests_ = 0;

    platform::Thread thread_;  // last: stopped and joined before the members above go
};

}  // namespace testsupport
