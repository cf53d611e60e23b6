// A classic STUN responder for the answers no real server gives: silence, a wrong transaction id,
// a missing CHANGED-ADDRESS, arbitrary bytes, a translated mapped port, or an answer to a
// RESPONSE-ADDRESS sent from the very socket the request went to. It listens on one UDP socket
// on its own thread and records every request it gets.
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
        kAnswer,              // a Binding Response with MAPPED, SOURCE and CHANGED-ADDRESS
        kSilent,              // count and record, never answer
        kWrongTransactionId,  // a normal answer whose id differs from the request's
        kNoChangedAddress,    // a normal answer without CHANGED-ADDRESS
        kRaw,                 // the bytes given to SetRawAnswer
    };

    struct Request {
        std::vector<uint8_t> bytes;
        uint32_t fromAddress = 0;
        uint16_t fromPort = 0;
        uint64_t tickMs = 0;  // platform::GetTickCount64() at arrival
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
    // Sent verbatim in kRaw mode; with copyTransactionId the request's id is written over bytes
    // 4..19 first (when the answer is that long), so that the answer reaches the parser.
    void SetRawAnswer(std::vector<uint8_t> bytes, bool copyTransactionId = true);
    // MAPPED-ADDRESS carries this port instead of the sender's (a port-translating NAT).
    void SetMappedPort(std::optional<uint16_t> port);
    // Defaults: SOURCE-ADDRESS is the answering socket, CHANGED-ADDRESS the listening one.
    void SetSourceAddress(uint32_t address, uint16_t port);
    void SetChangedAddress(uint32_t address, uint16_t port);
    // From now on answers leave from a second socket bound to address:port (port 0: any).
    // Returns false when that bind fails. AnswerPort() tells the port it got.
    bool AnswerFrom(uint32_t address, uint16_t port);
    uint32_t AnswerAddress() const;
    uint16_t AnswerPort() const;

    int RequestCount() const;
    // Waits until at least count requests have arrived; false on timeout.
    bool WaitForRequests(int count, int timeoutMs) const;
    std::vector<Request> Requests() const;
    // An empty request when none arrived yet.
    Request LastRequest() const;

  private:
    void Run();
    void Answer(const Request& request);
    std::vector<uint8_t> BuildResponse(const Request& request, const uint8_t* transactionId,
                                       uint32_t fromAddress, uint16_t fromPort,
                                       bool reflected) const;

    platform::Socket socket_;
    uint32_t address_ = 0;
    uint16_t port_ = 0;
    bool running_ = false;

    mutable std::mutex mutex_;
    mutable std::condition_variable arrived_;
    Mode mode_ = Mode::kAnswer;
    std::vector<uint8_t> raw_;
    bool copyTransactionId_ = true;
    std::optional<uint16_t> mappedPort_;
    std::optional<std::pair<uint32_t, uint16_t>> source_;
    std::optional<std::pair<uint32_t, uint16_t>> changed_;
    platform::Socket answerSocket_;
    uint32_t answerAddress_ = 0;
    uint16_t answerPort_ = 0;
    std::vector<Request> requests_;

    platform::Thread thread_;  // last: stopped and joined before the members above go
};

}  // namespace testsupport
