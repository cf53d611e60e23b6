// The classic STUN codec: exact request bytes, and what a response parse accepts, keeps and
// refuses. Responses are built byte by byte here, apart from one datagram captured from stund.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>
#include <tuple>
#include <vector>

#include "foundation/NetUtils.h"
#include "platform/net.h"
#include "stun/STUNMessage.h"
#include "tests/support/LogCapture.h"
#include "tests/support/StunBytes.h"

namespace {

using Bytes = std::vector<uint8_t>;
using stun::CSTUNMessage;
using testsupport::Put16;

constexpr uint32_t kLoopback = 0x7F000001;

// A Binding Request answer of stund 0.97 from 127.23.45.1:3478 to 127.0.0.1:56362: MAPPED,
// SOURCE, CHANGED, the old XOR-MAPPED (0x0020) and SERVER "Vovida.org 0.97".
const char kStundAnswerHex[] =
    "01010044e39d259e051394df1887c997ea5df880"
    "000100080001dc2a7f000001"
    "0004000800010d967f172d01"
    "0005000800010d977f172d02"
    "0020000800013fb79c9d259f"
    "80220010566f766964612e6f726720302e393700";

Bytes FromHex(const std::string& hex) {
    Bytes out;
    for (size_t i = 0; i + 1 < hex.size(); i += 2) {
        out.push_back(static_cast<uint8_t>(std::stoi(hex.substr(i, 2), nullptr, 16)));
    }
    return out;
}

// Type, length, family, address, port of an address slot.
using Slot = std::tuple<int, int, int, uint32_t, int>;
Slot SlotOf(const stun::STUNAddressAttribute& a) {
    return {a.m_type, a.m_length, a.m_family, a.m_address, a.m_port};
}

// A response: header with the right length unless told otherwise, id A0..AF, then attributes.
class Response {
  public:
    explicit Response(uint16_t type = 0x0101) : type_(type) {}
    Response& Attr(uint16_t type, const Bytes& value) {
        return Raw(type, static_cast<uint16_t>(value.size()), value);
    }
    // Declared length and value bytes independent of each other.
    Response& Raw(uint16_t type, uint16_t declared, const Bytes& value) {
        Put16(body_, type);
        Put16(body_, declared);
        return Tail(value);
    }
    Response& Address(uint16_t type, uint32_t address, uint16_t port, uint8_t family = 1) {
        return Attr(type, AddressValue(address, port, family));
    }
    Response& Tail(const Bytes& bytes) {
        body_.insert(body_.end(), bytes.begin(), bytes.end());
        return *this;
    }
    Response& LengthDelta(int delta) {
        lengthDelta_ = delta;
        return *this;
    }
    Bytes Build() const {
        Bytes b;
        Put16(b, type_);
        Put16(b, static_cast<uint16_t>(static_cast<int>(body_.size()) + lengthDelta_));
        for (int i = 0; i < 16; ++i) {
            b.push_back(static_cast<uint8_t>(0xA0 + i));
        }
        b.insert(b.end(), body_.begin(), body_.end());
        return b;
    }
    static Bytes AddressValue(uint32_t address, uint16_t port, uint8_t family = 1) {
        Bytes v{0, family};
        Put16(v, port);
        Put16(v, static_cast<uint16_t>(address >> 16));
        Put16(v, static_cast<uint16_t>(address));
        return v;
    }

  private:
    uint16_t type_;
    int lengthDelta_ = 0;
    Bytes body_;
};

bool DecodeExact(CSTUNMessage& m, const Bytes& bytes) {
    // A heap copy of exactly this size, so that any read past the end is an ASan error.
    std::vector<uint8_t> copy(bytes);
    return m.Decode(copy.empty() ? nullptr : copy.data(), copy.size());
}

Bytes Encode(const CSTUNMessage& m) {
    uint8_t buffer[64];
    return Bytes(buffer, buffer + m.Encode(buffer, sizeof buffer));
}

void SetChange(CSTUNMessage& m, uint32_t flags, uint16_t length) {
    m.m_changeRequest = {stun::STUN_CHANGE_REQUEST, 4, flags};
    m.m_messageLength = length;
}

void SetResponseAddress(CSTUNMessage& m, uint32_t address, uint16_t port, uint16_t length) {
    m.m_responseAddress = {stun::STUN_RESPONSE_ADDRESS, 8, 0, 1, port, address};
    m.m_messageLength = length;
}

TEST(STUNMessageEncode, WritesExactRequestBytes) {
    const struct {
        const char* name;
        std::function<void(CSTUNMessage&)> fill;
        const char* afterId;  // hex of what follows the 20-byte header
        uint16_t length;
    } cases[] = {
        {"plain", [](CSTUNMessage&) {}, "", 0},
        {"change both", [](CSTUNMessage& m) { SetChange(m, 6, 8); }, "0003000400000006", 8},
        {"response address only",
         [](CSTUNMessage& m) { SetResponseAddress(m, 0xC0A80102, 0x1F90, 12); },
         "0002000800011f90c0a80102", 12},
        // Filled in the opposite order: the wire order must still put CHANGE-REQUEST first.
        {"response address test",
         [](CSTUNMessage& m) {
             SetResponseAddress(m, kLoopback, 0xEA60, 0);
             SetChange(m, 6, 20);
         },
         "0003000400000006"
         "000200080001ea607f000001",
         20},
        // Presence means the slot type equals the attribute's own code.
        {"slot with a foreign type is absent",
         [](CSTUNMessage& m) {
             SetChange(m, 6, 0);
             m.m_changeRequest.m_type = stun::STUN_RESPONSE_ADDRESS;
             SetResponseAddress(m, 1, 1, 0);
             m.m_responseAddress.m_type = stun::STUN_CHANGE_REQUEST;
         },
         "", 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        CSTUNMessage m(stun::STUN_BINDING_REQUEST);
        for (int i = 0; i < 16; ++i) {
            m.m_transactionId[i] = static_cast<uint8_t>(i * 17);
        }
        // Read-only slots, present in every case, are never written.
        m.m_mappedAddress = {stun::STUN_MAPPED_ADDRESS, 8, 0, 1, 1, 1};
        m.m_sourceAddress = {stun::STUN_SOURCE_ADDRESS, 8, 0, 1, 1, 1};
        m.m_changedAddress = {stun::STUN_CHANGED_ADDRESS, 8, 0, 1, 1, 1};
        m.m_reflectedFrom = {stun::STUN_REFLECTED_FROM, 8, 0, 1, 1, 1};
        c.fill(m);
        Bytes expected;
        expected.reserve(64);  // also spares GCC 12 a false bounds warning on the inserts
        Put16(expected, stun::STUN_BINDING_REQUEST);
        Put16(expected, c.length);
        expected.insert(expected.end(), m.m_transactionId, m.m_transactionId + 16);
        const Bytes rest = FromHex(c.afterId);
        expected.insert(expected.end(), rest.begin(), rest.end());
        EXPECT_EQ(Encode(m), expected);
        // One byte short of room: nothing is claimed written.
        Bytes small(expected.size() - 1);
        EXPECT_EQ(m.Encode(small.data(), small.size()), 0u);
    }
}

TEST(STUNMessageReset, ClearsEverythingAndDrawsAnUnguessableId) {
    CSTUNMessage m(0x0111);
    SetChange(m, 6, 8);
    SetResponseAddress(m, 1, 2, 8);
    m.m_mappedAddress.m_type = stun::STUN_MAPPED_ADDRESS;
    m.m_sourceAddress.m_type = stun::STUN_SOURCE_ADDRESS;
    m.m_changedAddress.m_type = stun::STUN_CHANGED_ADDRESS;
    m.m_reflectedFrom.m_type = stun::STUN_REFLECTED_FROM;

    // The same seed before each draw: an id from rand() would repeat.
    std::srand(4242);
    m.Reset();
    std::srand(4242);
    CSTUNMessage other;
    EXPECT_NE(std::memcmp(m.m_transactionId, other.m_transactionId, 16), 0);
    EXPECT_EQ(std::make_tuple(m.m_messageType, m.m_messageLength, m.m_mappedAddress.m_type,
                              m.m_responseAddress.m_type, m.m_changeRequest.m_type,
                              m.m_sourceAddress.m_type, m.m_changedAddress.m_type,
                              m.m_reflectedFrom.m_type),
              std::make_tuple(0, 0, 0, 0, 0, 0, 0, 0));
    EXPECT_EQ(Encode(m).size(), 20u);
}

TEST(STUNMessageDecode, AcceptsOrRefusesByStructure) {
    const uint32_t a = 0x01020304;
    const struct {
        const char* name;
        Bytes datagram;
        bool accepted;
    } cases[] = {
        {"empty", {}, false},
        {"header only", Response().Build(), false},
        {"one attribute", Response().Address(1, a, 5).Build(), true},
        {"length one too big", Response().Address(1, a, 5).LengthDelta(+1).Build(), false},
        {"length one too small", Response().Address(1, a, 5).LengthDelta(-1).Build(), false},
        {"attribute header cut after 3 bytes",
         Response().Address(1, a, 5).Tail({0x80, 0x22, 0x00}).Build(), false},
        {"unknown attribute overrunning", Response().Raw(0x8022, 10, Bytes(8, 'x')).Build(), false},
        {"address attribute overrunning", Response().Raw(4, 8, {0, 1, 0, 5}).Build(), false},
        {"address attribute shorter than 8", Response().Raw(5, 4, {0, 1, 0, 5}).Build(), false},
        {"address attribute of length 0 at the end", Response().Raw(0xB, 0, {}).Build(), false},
        {"unknown attribute of length 0", Response().Raw(0x8020, 0, {}).Build(), true},
        // Error responses are not looked at.
        {"binding error response", Response(0x0111).Address(1, a, 5).Build(), true},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        CSTUNMessage m;
        EXPECT_EQ(DecodeExact(m, c.datagram), c.accepted);
    }
}

TEST(STUNMessageDecode, ReadsTheStundAnswer) {
    const Bytes datagram = FromHex(kStundAnswerHex);
    CSTUNMessage m;
    ASSERT_TRUE(DecodeExact(m, datagram));
    EXPECT_EQ(m.m_messageType, 0x0101);
    EXPECT_EQ(m.m_messageLength, 68);
    EXPECT_EQ(std::memcmp(m.m_transactionId, datagram.data() + 4, 16), 0);
    EXPECT_EQ(SlotOf(m.m_mappedAddress), Slot(1, 8, 1, 0x7F000001, 56362));
    EXPECT_EQ(SlotOf(m.m_sourceAddress), Slot(4, 8, 1, 0x7F172D01, 3478));
    EXPECT_EQ(SlotOf(m.m_changedAddress), Slot(5, 8, 1, 0x7F172D02, 3479));
    EXPECT_EQ(m.m_reflectedFrom.m_type, 0);
    EXPECT_TRUE(m.HasMandatoryAttributes());
}

TEST(STUNMessageDecode, KeepsTheRightValues) {
    CSTUNMessage m;
    // The later of two MAPPED-ADDRESS attributes wins.
    ASSERT_TRUE(
        DecodeExact(m, Response().Address(1, 0x0A000001, 1).Address(1, 0x0A000002, 2).Build()));
    EXPECT_EQ(SlotOf(m.m_mappedAddress), Slot(1, 8, 1, 0x0A000002, 2));

    // An unknown attribute of odd length is stepped over by its declared length.
    ASSERT_TRUE(DecodeExact(
        m, Response().Attr(0x8022, {'a', 'b', 'c'}).Address(4, 0xC0A80001, 3478).Build()));
    EXPECT_EQ(SlotOf(m.m_sourceAddress), Slot(4, 8, 1, 0xC0A80001, 3478));

    // REFLECTED-FROM is read; RESPONSE-ADDRESS and CHANGE-REQUEST are not; nothing of the
    // previous parse survives.
    ASSERT_TRUE(DecodeExact(m, Response()
                                   .Address(2, 0x01010101, 11)
                                   .Attr(3, {0, 0, 0, 6})
                                   .Address(0xB, 0x02020202, 22)
                                   .Build()));
    EXPECT_EQ(std::make_tuple(m.m_responseAddress.m_type, m.m_changeRequest.m_type,
                              m.m_sourceAddress.m_type),
              std::make_tuple(0, 0, 0));
    EXPECT_EQ(SlotOf(m.m_reflectedFrom), Slot(0xB, 8, 1, 0x02020202, 22));

    // An address attribute always takes 8 value bytes and 12 in all, whatever it declares.
    ASSERT_TRUE(DecodeExact(m, Response()
                                   .Raw(1, 0, Response::AddressValue(0x03030303, 33))
                                   .Address(5, 0x04040404, 44)
                                   .Build()));
    EXPECT_EQ(SlotOf(m.m_mappedAddress), Slot(1, 0, 1, 0x03030303, 33));
    EXPECT_EQ(SlotOf(m.m_changedAddress), Slot(5, 8, 1, 0x04040404, 44));
}

TEST(STUNMessageDecode, MandatoryAttributesNeedAllThree) {
    // REFLECTED-FROM is always there and must not stand in for any of them.
    for (uint16_t missing : {0x0000, 0x0001, 0x0004, 0x0005}) {
        SCOPED_TRACE(missing);
        Response r;
        for (uint16_t type : {0x0001, 0x0004, 0x0005, 0x000B}) {
            if (type != missing) {
                r.Address(type, 0x0A000001, type);
            }
        }
        CSTUNMessage m;
        ASSERT_TRUE(DecodeExact(m, r.Build()));
        EXPECT_EQ(m.HasMandatoryAttributes(), missing == 0);
        // Presence compares each slot with its own code, not just with non-zero.
        m.m_sourceAddress.m_type = stun::STUN_MAPPED_ADDRESS;
        EXPECT_FALSE(m.HasMandatoryAttributes());
    }
}

// Cut anywhere with the header length made to match: accepted exactly at attribute boundaries;
// with the original header length only the whole datagram is.
TEST(STUNMessageDecode, TruncatedStundAnswers) {
    const Bytes whole = FromHex(kStundAnswerHex);
    const std::vector<size_t> boundaries = {32, 44, 56, 68, 88};
    for (size_t cut = 0; cut <= whole.size(); ++cut) {
        SCOPED_TRACE(cut);
        Bytes part(whole.begin(), whole.begin() + static_cast<std::ptrdiff_t>(cut));
        CSTUNMessage m;
        EXPECT_EQ(DecodeExact(m, part), cut == whole.size());
        if (cut >= 4) {
            part[2] = static_cast<uint8_t>((cut - 20) >> 8);
            part[3] = static_cast<uint8_t>(cut - 20);
        }
        EXPECT_EQ(DecodeExact(m, part),
                  std::find(boundaries.begin(), boundaries.end(), cut) != boundaries.end());
    }
}

TEST(STUNMessageDecode, LogsEachAddressAttributeAtInfo) {
    const Bytes datagram = Response()
                               .Address(1, 0x01020304, 5)
                               .Attr(0x8022, {'s'})
                               .Address(4, 0x0A000001, 3478)
                               .Address(5, 0x0A000002, 3479)
                               .Address(0xB, 0xC0A80001, 65535)
                               .Build();
    const std::vector<std::string> expected = {
        "STUN_MAPPED_ADDRESS: 1.2.3.4:5", "STUN_SOURCE_ADDRESS: 10.0.0.1:3478",
        "STUN_CHANGED_ADDRESS: 10.0.0.2:3479", "STUN_REFLECTED_FROM: 192.168.0.1:65535"};
    testsupport::LogCapture capture;
    CSTUNMessage m;
    ASSERT_TRUE(DecodeExact(m, datagram));
    std::vector<std::string> got;
    for (const testsupport::LogLine& line : capture.LinesOf("CSTUNMessage::RecvFrom")) {
        EXPECT_EQ(line.level, "INFO") << line.message;
        got.push_back(line.message);
    }
    EXPECT_EQ(got, expected);
}

TEST(STUNMessageSocket, RecvFromTakesAtMost1024Bytes) {
    uint16_t clientPort = 0;
    uint16_t serverPort = 0;
    const platform::Socket clientSocket = foundation::CreateUdpSocket(kLoopback, &clientPort);
    const platform::Socket serverSocket = foundation::CreateUdpSocket(kLoopback, &serverPort);
    ASSERT_TRUE(clientSocket && serverSocket);
    const platform::SocketHandle client = clientSocket.Get();
    const platform::SocketHandle server = serverSocket.Get();
    for (const auto& [size, accepted] : {std::pair{1024, true}, {1025, false}, {20, false}}) {
        SCOPED_TRACE(size);
        Response r;
        if (size > 20) {
            r.Address(1, 0x01020304, 5).Attr(0x8022, Bytes(size - 20 - 12 - 4, 'p'));
        }
        const Bytes datagram = r.Build();
        ASSERT_EQ(platform::SendTo(server, datagram.data(), datagram.size(), kLoopback, clientPort),
                  size);
        CSTUNMessage m;
        uint32_t from = 0;
        uint16_t fromPort = 0;
        EXPECT_EQ(m.RecvFrom(client, from, fromPort, 2000), accepted);
        if (accepted) {
            EXPECT_EQ(std::make_tuple(from, fromPort, m.m_mappedAddress.m_address),
                      std::make_tuple(kLoopback, serverPort, 0x01020304u));
        }
    }
    // Nothing queued: a time-out, the sender untouched, and a fresh id after the reset.
    CSTUNMessage m;
    const Bytes before(m.m_transactionId, m.m_transactionId + 16);
    uint32_t from = 0xDEADBEEF;
    uint16_t fromPort = 7;
    EXPECT_FALSE(m.RecvFrom(client, from, fromPort, 50));
    EXPECT_EQ(std::make_pair(from, fromPort), std::make_pair(0xDEADBEEFu, uint16_t{7}));
    EXPECT_NE(Bytes(m.m_transactionId, m.m_transactionId + 16), before);
}

}  // namespace
