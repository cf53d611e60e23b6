#include "stun/STUNTransaction.h"

#include <algorithm>
#include <cstring>
#include <limits>

#include "platform/kernel.h"

namespace stun {

namespace {

constexpr int kFirstWaitMs = 100;
constexpr int kMaxWaitMs = 1600;

bool SendRequest(foundation::SocketHandle s, const STUNSend& send, uint32_t address,
                 uint16_t port) {
    const int sent =
        foundation::SendDatagram(s, send.bytes.data(), send.bytes.size(), address, port);
    return sent >= 0 && static_cast<size_t>(sent) == send.bytes.size();
}

// Sends from sender and waits on receiver as the transaction decides. fromAddress/fromPort receive
// the sender of every datagram received. False on a send failure, a stop request of the calling
// thread's owner, or when the attempts are used up.
bool Drive(CSTUNTransaction& transaction, foundation::SocketHandle sender,
           foundation::SocketHandle receiver, uint32_t serverAddress, uint16_t serverPort,
           uint32_t& fromAddress, uint16_t& fromPort) {
    uint64_t now = platform::GetTickCount64();
    std::optional<STUNSend> send = transaction.Start(now);
    while (send) {
        if (platform::CurrentThreadStopRequested()) {
            return false;
        }
        if (!SendRequest(sender, *send, serverAddress, serverPort)) {
            return false;
        }
        // The whole wait from after the send, as the schedule says, whatever the clock's grain.
        const uint64_t waitMs = send->deadlineMs > now ? send->deadlineMs - now : 0;
        uint8_t buffer[kSTUNReceiveBufferSize];
        const int received = foundation::ReceiveDatagram(
            receiver, buffer, sizeof buffer, &fromAddress, &fromPort,
            static_cast<int>(std::min<uint64_t>(waitMs, std::numeric_limits<int>::max())));
        now = platform::GetTickCount64();
        if (received > 0 &&
            transaction.OnDatagram(now, buffer, static_cast<size_t>(received), fromAddress,
                                   fromPort) == CSTUNTransaction::Verdict::kAccepted) {
            return true;
        }
        // A wrong or stray datagram ends this wait early; the request is simply sent again.
        send = transaction.OnTimeout(now);
    }
    return false;
}

}  // namespace

CSTUNTransaction::CSTUNTransaction(const CSTUNMessage& request, int attempts)
    : m_attempts(attempts) {
    m_requestSize = request.Encode(m_request, sizeof m_request);
    std::memcpy(m_transactionId, request.m_transactionId, kSTUNTransactionIdSize);
}

STUNSend CSTUNTransaction::BeginAttempt(uint64_t nowMs) {
    ++m_attempt;
    m_waitMs = m_attempt == 1 ? kFirstWaitMs : std::min(m_waitMs * 2, kMaxWaitMs);
    m_deadlineMs = nowMs + static_cast<uint64_t>(m_waitMs);
    m_state = State::kWaiting;
    // Each attempt receives afresh, so a refused datagram of an earlier one is not left over.
    m_response.Reset();
    return STUNSend{std::span<const uint8_t>(m_request, m_requestSize), m_deadlineMs};
}

std::optional<STUNSend> CSTUNTransaction::Start(uint64_t nowMs) {
    if (m_state != State::kIdle || m_attempts < 1 || m_requestSize == 0) {
        m_state = State::kGaveUp;
        return std::nullopt;
    }
    return BeginAttempt(nowMs);
}

CSTUNTransaction::Verdict CSTUNTransaction::OnDatagram(uint64_t nowMs, const uint8_t* bytes,
                                                       size_t length, uint32_t fromAddress,
                                                       uint16_t fromPort) {
    if (m_state != State::kWaiting) {
        return Verdict::kIgnored;  // late, or a duplicate of the accepted answer
    }
    if (!m_response.Decode(bytes, length) ||
        std::memcmp(m_response.m_transactionId, m_transactionId, kSTUNTransactionIdSize) != 0) {
        m_deadlineMs = nowMs;
        return Verdict::kIgnored;
    }
    m_state = State::kAccepted;
    m_answerAddress = fromAddress;
    m_answerPort = fromPort;
    return Verdict::kAccepted;
}

std::optional<STUNSend> CSTUNTransaction::OnTimeout(uint64_t nowMs) {
    if (m_state != State::kWaiting) {
        return std::nullopt;
    }
    if (m_attempt >= m_attempts) {
        m_state = State::kGaveUp;
        return std::nullopt;
    }
    return BeginAttempt(nowMs);
}

CSTUNMessage MakeBindingRequest(bool changeIp, bool changePort) {
    CSTUNMessage request(STUN_BINDING_REQUEST);
    if (changeIp || changePort) {
        request.m_changeRequest.m_type = STUN_CHANGE_REQUEST;
        request.m_changeRequest.m_length = 4;
        request.m_changeRequest.m_flags =
            (changeIp ? STUN_CHANGE_IP : 0u) | (changePort ? STUN_CHANGE_PORT : 0u);
        request.m_messageLength = 8;
    }
    return request;
}

CSTUNMessage MakeResponseAddressRequest(uint32_t responseAddress, uint16_t listenPort) {
    CSTUNMessage request = MakeBindingRequest(true, true);
    request.m_responseAddress.m_type = STUN_RESPONSE_ADDRESS;
    request.m_responseAddress.m_length = 8;
    request.m_responseAddress.m_reserved = 0;
    request.m_responseAddress.m_family = STUN_FAMILY_IPV4;
    request.m_responseAddress.m_port = listenPort;
    request.m_responseAddress.m_address = responseAddress;
    request.m_messageLength = 20;
    return request;
}

bool IsAnswerFromElsewhere(uint32_t fromAddress, uint16_t fromPort, uint32_t serverAddress,
                           uint16_t serverPort) {
    return fromAddress != serverAddress && fromPort != serverPort;
}

bool STUN_RunTest(uint32_t localAddress, uint16_t* localPort, uint32_t serverAddress,
                  uint16_t serverPort, bool changeIp, bool changePort, CSTUNMessage& response,
                  uint32_t& fromAddress, uint16_t& fromPort) {
    const platform::Socket socket = foundation::CreateUdpSocket(localAddress, localPort);
    if (!socket.IsValid()) {
        return false;
    }
    CSTUNTransaction transaction(MakeBindingRequest(changeIp, changePort), kSTUNRunTestAttempts);
    const bool accepted = Drive(transaction, socket.Get(), socket.Get(), serverAddress, serverPort,
                                fromAddress, fromPort);
    response = transaction.Response();
    return accepted;
}

bool STUN_RunResponseAddressTest(uint32_t localAddress, uint32_t serverAddress, uint16_t serverPort,
                                 uint32_t responseAddress) {
    uint16_t sendPort = 0;
    const platform::Socket sender = foundation::CreateUdpSocket(localAddress, &sendPort);
    if (!sender.IsValid()) {
        return false;
    }
    // The listening socket must not have sent anything: only an unsolicited datagram counts.
    uint16_t listenPort = 0;
    const platform::Socket listener = foundation::CreateUdpSocket(localAddress, &listenPort);
    if (!listener.IsValid()) {
        return false;
    }
    CSTUNTransaction transaction(MakeResponseAddressRequest(responseAddress, listenPort),
                                 kSTUNResponseAddressAttempts);
    uint32_t fromAddress = 0;
    uint16_t fromPort = 0;
    return Drive(transaction, sender.Get(), listener.Get(), serverAddress, serverPort, fromAddress,
                 fromPort) &&
           IsAnswerFromElsewhere(transaction.AnswerAddress(), transaction.AnswerPort(),
                                 serverAddress, serverPort);
}

}  // namespace stun
