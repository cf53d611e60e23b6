#include "stun/STUNMessage.h"

#include <cstdlib>
#include <cstring>

#include "foundation/Logger.h"
#include "platform/random.h"

namespace stun {

namespace {

// Decode logs the address lines for RecvFrom and for the transactions, which receive without
// it, under the one name those lines have always carried.
constexpr const char* kRecvFromName = "CSTUNMessage::RecvFrom";

uint16_t Read16(const uint8_t* p) {
    return static_cast<uint16_t>((static_cast<unsigned>(p[0]) << 8) | p[1]);
}

uint32_t Read32(const uint8_t* p) {
    return (static_cast<uint32_t>(p[0]) << 24) | (static_cast<uint32_t>(p[1]) << 16) |
           (static_cast<uint32_t>(p[2]) << 8) | static_cast<uint32_t>(p[3]);
}

uint8_t* Write16(uint8_t* p, uint16_t v) {
    p[0] = static_cast<uint8_t>(v >> 8);
    p[1] = static_cast<uint8_t>(v);
    return p + 2;
}

uint8_t* Write32(uint8_t* p, uint32_t v) {
    p[0] = static_cast<uint8_t>(v >> 24);
    p[1] = static_cast<uint8_t>(v >> 16);
    p[2] = static_cast<uint8_t>(v >> 8);
    p[3] = static_cast<uint8_t>(v);
    return p + 4;
}

// The slot an attribute type fills and the label of its log line; null for types we skip.
STUNAddressAttribute* AddressSlot(CSTUNMessage& m, uint16_t type, const char** label) {
    switch (type) {
        case STUN_MAPPED_ADDRESS:
            *label = "STUN_MAPPED_ADDRESS";
            return &m.m_mappedAddress;
        case STUN_SOURCE_ADDRESS:
            *label = "STUN_SOURCE_ADDRESS";
            return &m.m_sourceAddress;
        case STUN_CHANGED_ADDRESS:
            *label = "STUN_CHANGED_ADDRESS";
            return &m.m_changedAddress;
        case STUN_REFLECTED_FROM:
            *label = "STUN_REFLECTED_FROM";
            return &m.m_reflectedFrom;
        default:
            return nullptr;
    }
}

}  // namespace

CSTUNMessage::CSTUNMessage() {
    Reset();
}

CSTUNMessage::CSTUNMessage(uint16_t messageType) {
    Reset();
    m_messageType = messageType;
}

void CSTUNMessage::ClearFields() {
    m_messageType = 0;
    m_messageLength = 0;
    m_mappedAddress = {};
    m_responseAddress = {};
    m_changeRequest = {};
    m_sourceAddress = {};
    m_changedAddress = {};
    m_reflectedFrom = {};
}

void CSTUNMessage::Reset() {
    ClearFields();
    // An id an off-path host can guess lets it forge the answer that sets our public address.
    if (!platform::RandomBytes(m_transactionId, sizeof m_transactionId)) {
        // Only a system without a generator gets here: a guessable id still beats none.
        for (uint8_t& b : m_transactionId) {
            b = static_cast<uint8_t>(std::rand() & 0xFF);
        }
    }
}

size_t CSTUNMessage::Encode(uint8_t* out, size_t capacity) const {
    const bool hasChange = m_changeRequest.m_type == STUN_CHANGE_REQUEST;
    const bool hasResponse = m_responseAddress.m_type == STUN_RESPONSE_ADDRESS;
    const size_t size = kSTUNHeaderSize + (hasChange ? 8 : 0) + (hasResponse ? 12 : 0);
    if (out == nullptr || capacity < size) {
        return 0;
    }
    uint8_t* p = Write16(out, m_messageType);
    p = Write16(p, m_messageLength);
    std::memcpy(p, m_transactionId, kSTUNTransactionIdSize);
    p += kSTUNTransactionIdSize;
    // Servers from this era expect CHANGE-REQUEST first.
    if (hasChange) {
        p = Write16(p, STUN_CHANGE_REQUEST);
        p = Write16(p, m_changeRequest.m_length);
        p = Write32(p, m_changeRequest.m_flags);
    }
    if (hasResponse) {
        p = Write16(p, STUN_RESPONSE_ADDRESS);
        p = Write16(p, m_responseAddress.m_length);
        *p++ = m_responseAddress.m_reserved;
        *p++ = m_responseAddress.m_family;
        p = Write16(p, m_responseAddress.m_port);
        p = Write32(p, m_responseAddress.m_address);
    }
    return static_cast<size_t>(p - out);
}

bool CSTUNMessage::Decode(const uint8_t* data, size_t length) {
    ClearFields();
    if (data == nullptr || length <= kSTUNHeaderSize) {
        return false;
    }
    m_messageType = Read16(data);
    m_messageLength = Read16(data + 2);
    std::memcpy(m_transactionId, data + 4, kSTUNTransactionIdSize);
    if (m_messageLength != length - kSTUNHeaderSize) {
        return false;
    }

    size_t offset = kSTUNHeaderSize;
    while (offset < length) {
        const size_t remaining = length - offset;
        if (remaining < 4) {
            return false;
        }
        const uint16_t type = Read16(data + offset);
        const uint16_t attrLength = Read16(data + offset + 2);
        if (attrLength > remaining - 4) {
            return false;
        }
        const char* label = nullptr;
        STUNAddressAttribute* slot = AddressSlot(*this, type, &label);
        if (slot == nullptr) {
            offset += 4 + attrLength;
            continue;
        }
        // The value is read as 8 bytes whatever length is declared, as servers of this era
        // are not always consistent about it; the walk then steps over exactly those 8 bytes.
        if (remaining - 4 < kSTUNAddressValueSize) {
            return false;
        }
        const uint8_t* v = data + offset + 4;
        slot->m_type = type;
        slot->m_length = attrLength;
        slot->m_reserved = v[0];
        slot->m_family = v[1];
        slot->m_port = Read16(v + 2);
        slot->m_address = Read32(v + 4);
        if (foundation::Logger().IsEnabledFor(foundation::kLogInfo)) {
            NQ_LOG(kRecvFromName, foundation::kLogInfo, "%s: %s:%d", label,
                   foundation::FormatHostAddress(slot->m_address).c_str(),
                   static_cast<int>(slot->m_port));
        }
        offset += 4 + kSTUNAddressValueSize;
    }
    return true;
}

bool CSTUNMessage::SendTo(foundation::SocketHandle s, uint32_t address, uint16_t port) const {
    uint8_t buffer[kSTUNMaxRequestSize];
    const size_t size = Encode(buffer, sizeof buffer);
    if (size == 0) {
        return false;
    }
    const int sent = foundation::SendDatagram(s, buffer, size, address, port);
    return sent >= 0 && static_cast<size_t>(sent) == size;
}

bool CSTUNMessage::RecvFrom(foundation::SocketHandle s, uint32_t& fromAddress, uint16_t& fromPort,
                            int timeoutMs) {
    Reset();
    uint8_t buffer[kSTUNReceiveBufferSize];
    const int received =
        foundation::ReceiveDatagram(s, buffer, sizeof buffer, &fromAddress, &fromPort, timeoutMs);
    if (received <= static_cast<int>(kSTUNHeaderSize)) {
        return false;
    }
    return Decode(buffer, static_cast<size_t>(received));
}

bool CSTUNMessage::HasMandatoryAttributes() const {
    return m_mappedAddress.m_type == STUN_MAPPED_ADDRESS &&
           m_sourceAddress.m_type == STUN_SOURCE_ADDRESS &&
           m_changedAddress.m_type == STUN_CHANGED_ADDRESS;
}

}  // namespace stun
