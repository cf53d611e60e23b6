// One classic STUN message (RFC 3489 Binding Request / Response over UDP, no shared secret and no
// message integrity). The byte-level codec (Encode, Decode) does no I/O; SendTo and RecvFrom are
// thin socket wrappers around it. Ports and addresses are always held in host order.
#pragma once

#include <cstddef>
#include <cstdint>

#include "foundation/NetUtils.h"

namespace stun {

inline constexpr uint16_t STUN_BINDING_REQUEST = 0x0001;

// Attribute types the system knows. Only CHANGE-REQUEST and RESPONSE-ADDRESS are ever written;
// only the four address attributes other than RESPONSE-ADDRESS are ever read.
inline constexpr uint16_t STUN_MAPPED_ADDRESS = 0x0001;
inline constexpr uint16_t STUN_RESPONSE_ADDRESS = 0x0002;
inline constexpr uint16_t STUN_CHANGE_REQUEST = 0x0003;
inline constexpr uint16_t STUN_SOURCE_ADDRESS = 0x0004;
inline constexpr uint16_t STUN_CHANGED_ADDRESS = 0x0005;
inline constexpr uint16_t STUN_REFLECTED_FROM = 0x000B;

// CHANGE-REQUEST flags.
inline constexpr uint32_t STUN_CHANGE_IP = 0x04;
inline constexpr uint32_t STUN_CHANGE_PORT = 0x02;

inline constexpr uint8_t STUN_FAMILY_IPV4 = 0x01;

inline constexpr size_t kSTUNHeaderSize = 20;
inline constexpr size_t kSTUNTransactionIdSize = 16;
inline constexpr size_t kSTUNAddressValueSize = 8;
// Header plus CHANGE-REQUEST (8) plus RESPONSE-ADDRESS (12): the largest request we build.
inline constexpr size_t kSTUNMaxRequestSize = 40;
// Larger responses are refused by the receive itself.
inline constexpr size_t kSTUNReceiveBufferSize = 1024;

// An address attribute slot; m_type 0 means absent.
struct STUNAddressAttribute {
    uint16_t m_type = 0;
    uint16_t m_length = 0;
    uint8_t m_reserved = 0;
    uint8_t m_family = 0;
    uint16_t m_port = 0;
    uint32_t m_address = 0;
};

// The CHANGE-REQUEST slot; m_type 0 means absent.
struct STUNChangeRequest {
    uint16_t m_type = 0;
    uint16_t m_length = 0;
    uint32_t m_flags = 0;
};

class CSTUNMessage {
  public:
    // A reset message: type 0, length 0, no attributes, a fresh transaction id.
    CSTUNMessage();
    explicit CSTUNMessage(uint16_t messageType);

    // Clears type, length and all slots and draws a new transaction id from the system's
    // cryptographic generator.
    void Reset();

    // Writes the request datagram into out: header (type, the stored length, id), then
    // CHANGE-REQUEST and then RESPONSE-ADDRESS when their slots are present. Returns its size
    // (20, 28, 32 or 40), or 0 when capacity is too small.
    size_t Encode(uint8_t* out, size_t capacity) const;

    // Parses one received datagram into this message (slots cleared first). False for a
    // datagram of at most a header, a header length that is not the datagram's, or an attribute
    // cut short. Logs each address attribute read at INFO. Never reads outside [data, data+length).
    bool Decode(const uint8_t* data, size_t length);

    // Encode and send; true only when the whole datagram went out. address is host order.
    bool SendTo(foundation::SocketHandle s, uint32_t address, uint16_t port) const;

    // Reset, receive one datagram (at most kSTUNReceiveBufferSize bytes, timeoutMs as for
    // ReceiveDatagram) and Decode it. The sender is written whenever a datagram was received.
    bool RecvFrom(foundation::SocketHandle s, uint32_t& fromAddress, uint16_t& fromPort,
                  int timeoutMs);

    // MAPPED-ADDRESS, SOURCE-ADDRESS and CHANGED-ADDRESS all present.
    bool HasMandatoryAttributes() const;

    uint16_t m_messageType = 0;
    // Written into the header as is: whoever builds a request sets it.
    uint16_t m_messageLength = 0;
    uint8_t m_transactionId[kSTUNTransactionIdSize] = {};
    STUNAddressAttribute m_mappedAddress;
    STUNAddressAttribute m_responseAddress;
    STUNChangeRequest m_changeRequest;
    STUNAddressAttribute m_sourceAddress;
    STUNAddressAttribute m_changedAddress;
    STUNAddressAttribute m_reflectedFrom;

  private:
    void ClearFields();
};

}  // namespace stun
