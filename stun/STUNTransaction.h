// The two classic STUN transactions the classification and the diagnostics are built from. Each
// sends from sockets of its own, retransmits on a doubling wait and accepts the first response
// carrying the request's transaction id. Both block the calling thread (up to 4.7 s and 9.5 s) and
// end early, returning false, when the thread's owner asks it to stop.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

#include "stun/STUNMessage.h"

namespace stun {

inline constexpr int kSTUNRunTestAttempts = 6;
inline constexpr int kSTUNResponseAddressAttempts = 9;

// One request to send now, and the time its attempt ends.
struct STUNSend {
    std::span<const uint8_t> bytes;
    uint64_t deadlineMs = 0;
};

// The retransmission schedule and the response matching of one transaction, without I/O: the
// caller sends, waits and passes in what arrived and the time (ms, any monotonic origin). Waits
// start at 100 ms and double up to 1600 ms; every attempt sends the same request.
class CSTUNTransaction {
  public:
    enum class Verdict { kAccepted, kIgnored };

    CSTUNTransaction(const CSTUNMessage& request, int attempts);

    // The first attempt. Empty when there are no attempts at all.
    std::optional<STUNSend> Start(uint64_t nowMs);
    // Accepted: the datagram decodes and carries the request's id; Response() then holds it and
    // nothing else is accepted. Ignored: anything else, or the transaction is over. An ignored
    // datagram still ends the attempt: Deadline() becomes nowMs.
    Verdict OnDatagram(uint64_t nowMs, const uint8_t* bytes, size_t length, uint32_t fromAddress,
                       uint16_t fromPort);
    // The current attempt is over unanswered: the next one (the same bytes), or empty to give up.
    std::optional<STUNSend> OnTimeout(uint64_t nowMs);

    uint64_t Deadline() const { return m_deadlineMs; }
    bool IsAccepted() const { return m_state == State::kAccepted; }
    // The accepted answer; before one is, what the current attempt last received.
    const CSTUNMessage& Response() const { return m_response; }
    uint32_t AnswerAddress() const { return m_answerAddress; }
    uint16_t AnswerPort() const { return m_answerPort; }

  private:
    enum class State { kIdle, kWaiting, kAccepted, kGaveUp };
    STUNSend BeginAttempt(uint64_t nowMs);

    uint8_t m_request[kSTUNMaxRequestSize] = {};
    size_t m_requestSize = 0;
    uint8_t m_transactionId[kSTUNTransactionIdSize] = {};
    const int m_attempts;
    int m_attempt = 0;
    int m_waitMs = 0;
    uint64_t m_deadlineMs = 0;
    State m_state = State::kIdle;
    CSTUNMessage m_response;
    uint32_t m_answerAddress = 0;
    uint16_t m_answerPort = 0;
};

// The Binding Request of STUN_RunTest: CHANGE-REQUEST only when a change flag is set.
CSTUNMessage MakeBindingRequest(bool changeIp, bool changePort);
// The request of STUN_RunResponseAddressTest: change IP and port, answer to the listening socket.
CSTUNMessage MakeResponseAddressRequest(uint32_t responseAddress, uint16_t listenPort);
// An answer from the very address or port we sent to proves nothing about filtering.
bool IsAnswerFromElsewhere(uint32_t fromAddress, uint16_t fromPort, uint32_t serverAddress,
                           uint16_t serverPort);

// A Binding Request from localAddress (host order, 0 for any) to the server, with CHANGE-REQUEST
// when a change flag is set. localPort: null takes a rotating port, a pointer to 0 takes a
// rotating port and receives it, any other value binds exactly that port. On true, response holds
// the accepted answer; fromAddress/fromPort hold the sender of the last datagram received.
bool STUN_RunTest(uint32_t localAddress, uint16_t* localPort, uint32_t serverAddress,
                  uint16_t serverPort, bool changeIp, bool changePort, CSTUNMessage& response,
                  uint32_t& fromAddress, uint16_t& fromPort);

// Asks the server (change IP and port) to answer to a second local socket that has sent nothing,
// at responseAddress. True when the answer arrives there from an address and a port that both
// differ from the server's.
bool STUN_RunResponseAddressTest(uint32_t localAddress, uint32_t serverAddress, uint16_t serverPort,
                                 uint32_t responseAddress);

}  // namespace stun
