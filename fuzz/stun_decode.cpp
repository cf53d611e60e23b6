// A received STUN datagram through CSTUNMessage::Decode.
#include <algorithm>
#include <cstring>

#include "fuzz/FuzzSupport.h"
#include "stun/STUNMessage.h"

namespace {

// The attribute as it stood on the wire: type, declared length, then the 8 value bytes read.
bool StandsInDatagram(const stun::STUNAddressAttribute& a, const uint8_t* data, size_t size) {
    const uint8_t wire[12] = {static_cast<uint8_t>(a.m_type >> 8),
                              static_cast<uint8_t>(a.m_type),
                              static_cast<uint8_t>(a.m_length >> 8),
                              static_cast<uint8_t>(a.m_length),
                              a.m_reserved,
                              a.m_family,
                              static_cast<uint8_t>(a.m_port >> 8),
                              static_cast<uint8_t>(a.m_port),
                              static_cast<uint8_t>(a.m_address >> 24),
                              static_cast<uint8_t>(a.m_address >> 16),
                              static_cast<uint8_t>(a.m_address >> 8),
                              static_cast<uint8_t>(a.m_address)};
    const uint8_t* body = data + stun::kSTUNHeaderSize;
    return std::search(body, data + size, wire, wire + sizeof wire) != data + size;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    stun::CSTUNMessage message;
    if (!message.Decode(data, size)) {
        return 0;
    }
    FUZZ_CHECK(size > stun::kSTUNHeaderSize);
    FUZZ_CHECK(message.m_messageLength == size - stun::kSTUNHeaderSize);
    FUZZ_CHECK(std::memcmp(message.m_transactionId, data + 4, stun::kSTUNTransactionIdSize) == 0);
    for (const stun::STUNAddressAttribute* a :
         {&message.m_mappedAddress, &message.m_sourceAddress, &message.m_changedAddress,
          &message.m_reflectedFrom}) {
        FUZZ_CHECK(a->m_type == 0 || StandsInDatagram(*a, data, size));
    }
    // Never read, so never filled.
    FUZZ_CHECK(message.m_responseAddress.m_type == 0 && message.m_changeRequest.m_type == 0);
    return 0;
}
