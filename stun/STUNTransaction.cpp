#include "stun/STUNTransaction.h"

#include <algorithm>
#include <cstring>

#include "platform/kernel.h"

namespace stun {

namespace {

constexpr int kFirstWaitMs = 100;
constexpr int kMaxWaitMs = 1600;
constexpr int kRunTestAttempts = 6;
constexpr int kResponseAddressAttempts = 9;

int NextWait(int wait) {
    return std::min(wait * 2, kMaxWaitMs);
}

bool SameTransaction(const CSTUNMessage& a, const CSTUNMessage& b) {
    return std::memcmp(a.m_transactionId, b.m_transactionId, kSTUNTransactionIdSize) == 0;
}

}  // namespace

bool STUN_RunTest(uint32_t localAddress, uint16_t* localPort, uint32_t serverAddress,
                  uint16_t serverPort, bool changeIp, bool changePort, CSTUNMessage& response,
                  uint32_t& fromAddress, uint16_t& fromPort) {
    const platform::Socket socket = foundation::CreateUdpSocket(localAddress, localPort);
    if (!socket.IsValid()) {
        return false;
    }

    CSTUNMessage request;
    request.m_messageType = STUN_BINDING_REQUEST;
    if (changeIp || changePort) {
        request.m_changeRequest.m_type = STUN_CHANGE_REQUEST;
        request.m_changeRequest.m_length = 4;
        request.m_changeRequest.m_flags =
            (changeIp ? STUN_CHANGE_IP : 0u) | (changePort ? STUN_CHANGE_PORT : 0u);
        request.m_messageLength = 8;
    }

    int wait = kFirstWaitMs;
    for (int attempt = 0; attempt < kRunTestAttempts; ++attempt, wait = NextWait(wait)) {
        if (platform::CurrentThreadStopRequested()) {
            return false;
        }
        if (!request.SendTo(socket.Get(), serverAddress, serverPort)) {
            return false;
        }
        // A wrong or stray datagram ends this wait early; the request is simply sent again.
        if (response.RecvFrom(socket.Get(), fromAddress, fromPort, wait) &&
            SameTransaction(response, request)) {
            return true;
        }
    }
    return false;
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

    CSTUNMessage request;
    request.m_messageType = STUN_BINDING_REQUEST;
    request.m_changeRequest.m_type = STUN_CHANGE_REQUEST;
    request.m_changeRequest.m_length = 4;
    request.m_changeRequest.m_flags = STUN_CHANGE_IP | STUN_CHANGE_PORT;
    request.m_responseAddress.m_type = STUN_RESPONSE_ADDRESS;
    request.m_responseAddress.m_length = 8;
    request.m_responseAddress.m_reserved = 0;
    request.m_responseAddress.m_family = STUN_FAMILY_IPV4;
    request.m_responseAddress.m_port = listenPort;
    request.m_responseAddress.m_address = responseAddress;
    request.m_messageLength = 20;

    CSTUNMessage response;
    int wait = kFirstWaitMs;
    for (int attempt = 0; attempt < kResponseAddressAttempts; ++attempt, wait = NextWait(wait)) {
        if (platform::CurrentThreadStopRequested()) {
            return false;
        }
        if (!request.SendTo(sender.Get(), serverAddress, serverPort)) {
            return false;
        }
        uint32_t fromAddress = 0;
        uint16_t fromPort = 0;
        if (response.RecvFrom(listener.Get(), fromAddress, fromPort, wait) &&
            SameTransaction(response, request)) {
            // An answer from the very address or port we sent to proves nothing about filtering.
            return fromAddress != serverAddress && fromPort != serverPort;
        }
    }
    return false;
}

}  // namespace stun
