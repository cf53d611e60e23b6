// The classic STUN codec: exact request bytes, and what a response parse accepts, keeps and
// refuses. Responses are built byte by byte here, apart from one datagram captured from stund.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <mutex>
#include <random>
#include <string>
#include <vector>

#include "foundation/Logger.h"
#include "foundation/NetUtils.h"
#include "platform/kernel.h"
#include "platform/net.h"
#include "stun/STUNMessage.h"

namespace {

using Bytes = std::vector<uint8_t>;
using stun::CSTUNMessage;

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

void Put16(Bytes& b, uint16_t v) {
    b.push_back(static_cast<uint8_t>(v >> 8));
    b.push_back(static_cast<uint8_t>(v));
}

void Put32(Bytes& b, uint32_t v) {
    Put16(b, static_cast<uint16_t>(v >> 16));
    Put16(b, static_cast<uint16_t>(v));
}

// Builds a response: header with the right length unless told otherwise, then attributes.
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
        body_.insert(body_.end(), value.begin(), value.end());
        return *this;
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
        Put32(v, address);
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
    const size_t n = m.Encode(buffer, sizeof buffer);
    return Bytes(buffer, buffer + n);
}

// ---------------------------------------------------------------------------------------------
// Requests

struct EncodeCase {
    const char* name;
    std::function<void(CSTUNMessage&)> fill;
    Bytes expectedAfterId;  // what follows the 20-byte header
    uint16_t expectedLength;
};

Bytes RequestId() {
    Bytes id;
    for (int i = 0; i < 16; ++i) {
        id.push_back(static_cast<uint8_t>(i * 17));
    }
    return id;
}

void SetChange(CSTUNMessage& m, uint32_t flags) {
    m.m_changeRequest.m_type = stun::STUN_CHANGE_REQUEST;
    m.m_changeRequest.m_length = 4;
    m.m_changeRequest.m_flags = flags;
    m.m_messageLength = 8;
}

void SetResponseAddress(CSTUNMessage& m, uint32_t address, uint16_t port) {
    m.m_responseAddress.m_type = stun::STUN_RESPONSE_ADDRESS;
    m.m_responseAddress.m_length = 8;
    m.m_responseAddress.m_family = 1;
    m.m_responseAddress.m_port = port;
    m.m_responseAddress.m_address = address;
}

TEST(STUNMessageEncode, WritesExactRequestBytes) {
    const Bytes cr = {0x00, 0x03, 0x00, 0x04};
    const Bytes ra = {0x00, 0x02, 0x00, 0x08};
    auto cat = [](std::initializer_list<Bytes> parts) {
        Bytes out;
        for (const Bytes& p : parts) {
            out.insert(out.end(), p.begin(), p.end());
        }
        return out;
    };
    const std::vector<EncodeCase> cases = {
        {"plain", [](CSTUNMessage&) {}, {}, 0},
        {"change both", [](CSTUNMessage& m) { SetChange(m, 0x06); }, cat({cr, {0, 0, 0, 6}}), 8},
        {"response address only",
         [](CSTUNMessage& m) {
             SetResponseAddress(m, 0xC0A80102, 0x1F90);
             m.m_messageLength = 12;
         },
         cat({ra, {0, 1, 0x1F, 0x90, 0xC0, 0xA8, 0x01, 0x02}}), 12},
        // Filled in the opposite order: the wire order must still put CHANGE-REQUEST first.
        {"response address test",
         [](CSTUNMessage& m) {
             SetResponseAddress(m, 0x7F000001, 0xEA60);
             SetChange(m, 0x06);
             m.m_messageLength = 20;
         },
         cat({cr, {0, 0, 0, 6}, ra, {0, 1, 0xEA, 0x60, 0x7F, 0, 0, 1}}), 20},
        // Reserved and family go out as stored.
        {"odd reserved and family",
         [](CSTUNMessage& m) {
             SetResponseAddress(m, 0x0A000001, 1);
             m.m_responseAddress.m_reserved = 0xAB;
             m.m_responseAddress.m_family = 0x02;
             m.m_messageLength = 12;
         },
         cat({ra, {0xAB, 0x02, 0, 1, 0x0A, 0, 0, 1}}), 12},
        // The length is whatever the builder stored, never computed.
        {"stored length kept", [](CSTUNMessage& m) { m.m_messageLength = 0x1234; }, {}, 0x1234},
        // Presence means the slot type equals the attribute's own code.
        {"slot with a foreign type is absent",
         [](CSTUNMessage& m) {
             SetChange(m, 0x06);
             m.m_changeRequest.m_type = stun::STUN_RESPONSE_ADDRESS;
             SetResponseAddress(m, 1, 1);
             m.m_responseAddress.m_type = stun::STUN_CHANGE_REQUEST;
             m.m_messageLength = 0;
         },
         {},
         0},
        // MAPPED and the other read-only slots are never written.
        {"read-only slots not written",
         [](CSTUNMessage& m) {
             m.m_mappedAddress = {stun::STUN_MAPPED_ADDRESS, 8, 0, 1, 1, 1};
             m.m_sourceAddress = {stun::STUN_SOURCE_ADDRESS, 8, 0, 1, 1, 1};
             m.m_changedAddress = {stun::STUN_CHANGED_ADDRESS, 8, 0, 1, 1, 1};
             m.m_reflectedFrom = {stun::STUN_REFLECTED_FROM, 8, 0, 1, 1, 1};
         },
         {},
         0},
    };
    const Bytes id = RequestId();
    for (const EncodeCase& c : cases) {
        SCOPED_TRACE(c.name);
        CSTUNMessage m(stun::STUN_BINDING_REQUEST);
        std::memcpy(m.m_transactionId, id.data(), id.size());
        c.fill(m);

        Bytes expected = {0x00, 0x01, static_cast<uint8_t>(c.expectedLength >> 8),
                          static_cast<uint8_t>(c.expectedLength)};
        expected.insert(expected.end(), id.begin(), id.end());
        expected.insert(expected.end(), c.expectedAfterId.begin(), c.expectedAfterId.end());
        EXPECT_EQ(Encode(m), expected);

        // One byte short of room: nothing is claimed written.
        Bytes small(expected.size() - 1);
        EXPECT_EQ(m.Encode(small.data(), small.size()), 0u);
    }
}

TEST(STUNMessageReset, ClearsEverythingAndDrawsIdFromRandLowBytes) {
    CSTUNMessage m(0x0111);
    SetChange(m, 0x06);
    SetResponseAddress(m, 1, 2);
    m.m_mappedAddress.m_type = stun::STUN_MAPPED_ADDRESS;
    m.m_sourceAddress.m_type = stun::STUN_SOURCE_ADDRESS;
    m.m_changedAddress.m_type = stun::STUN_CHANGED_ADDRESS;
    m.m_reflectedFrom.m_type = stun::STUN_REFLECTED_FROM;

    std::srand(4242);
    uint8_t expected[16];
    for (uint8_t& b : expected) {
        b = static_cast<uint8_t>(std::rand() & 0xFF);
    }
    std::srand(4242);
    m.Reset();

    EXPECT_EQ(std::memcmp(m.m_transactionId, expected, 16), 0);
    EXPECT_EQ(m.m_messageType, 0);
    EXPECT_EQ(m.m_messageLength, 0);
    for (uint16_t type :
         {m.m_mappedAddress.m_type, m.m_responseAddress.m_type, m.m_changeRequest.m_type,
          m.m_sourceAddress.m_type, m.m_changedAddress.m_type, m.m_reflectedFrom.m_type}) {
        EXPECT_EQ(type, 0);
    }
    EXPECT_EQ(Encode(m).size(), 20u);

    // Every reset draws afresh.
    CSTUNMessage other;
    EXPECT_NE(std::memcmp(m.m_transactionId, other.m_transactionId, 16), 0);
}

// ---------------------------------------------------------------------------------------------
// Responses

struct DecodeCase {
    const char* name;
    Bytes datagram;
    bool accepted;
};

TEST(STUNMessageDecode, AcceptsOrRefusesByStructure) {
    const uint32_t a = 0x01020304;
    const std::vector<DecodeCase> cases = {
        {"empty", {}, false},
        {"shorter than a header", Bytes(19, 0), false},
        {"header only", Response().Build(), false},
        {"one attribute", Response().Address(0x0001, a, 5).Build(), true},
        {"length one more than the datagram",
         Response().Address(0x0001, a, 5).LengthDelta(+1).Build(), false},
        {"length one less than the datagram",
         Response().Address(0x0001, a, 5).LengthDelta(-1).Build(), false},
        {"attribute header cut after 2 bytes", Response().Tail({0x00, 0x01}).Build(), false},
        {"attribute header cut after 3 bytes",
         Response().Address(0x0001, a, 5).Tail({0x80, 0x22, 0x00}).Build(), false},
        {"unknown attribute overrunning the datagram",
         Response().Raw(0x8022, 10, Bytes(8, 'x')).Build(), false},
        {"address attribute overrunning the datagram",
         Response().Raw(0x0004, 8, {0, 1, 0, 5}).Build(), false},
        {"address attribute shorter than 8", Response().Raw(0x0005, 4, {0, 1, 0, 5}).Build(),
         false},
        {"address attribute of length 0 at the end", Response().Raw(0x000B, 0, {}).Build(), false},
        {"unknown attribute of length 0", Response().Raw(0x8020, 0, {}).Build(), true},
        {"unknown attribute of odd length", Response().Attr(0x8022, Bytes(5, 'x')).Build(), true},
        // Error responses and foreign families are not looked at.
        {"binding error response", Response(0x0111).Address(0x0001, a, 5).Build(), true},
        {"family 2", Response().Address(0x0001, a, 5, 2).Build(), true},
    };
    for (const DecodeCase& c : cases) {
        SCOPED_TRACE(c.name);
        CSTUNMessage m;
        EXPECT_EQ(DecodeExact(m, c.datagram), c.accepted);
    }
}

TEST(STUNMessageDecode, ReadsTheStundAnswer) {
    const Bytes datagram = FromHex(kStundAnswerHex);
    ASSERT_EQ(datagram.size(), 88u);
    CSTUNMessage m;
    ASSERT_TRUE(DecodeExact(m, datagram));

    EXPECT_EQ(m.m_messageType, 0x0101);
    EXPECT_EQ(m.m_messageLength, 68);
    EXPECT_EQ(std::memcmp(m.m_transactionId, datagram.data() + 4, 16), 0);
    struct Expected {
        const stun::STUNAddressAttribute& slot;
        uint16_t type;
        uint32_t address;
        uint16_t port;
    };
    for (const Expected& e : {Expected{m.m_mappedAddress, 0x0001, 0x7F000001, 56362},
                              Expected{m.m_sourceAddress, 0x0004, 0x7F172D01, 3478},
                              Expected{m.m_changedAddress, 0x0005, 0x7F172D02, 3479}}) {
        SCOPED_TRACE(e.type);
        EXPECT_EQ(e.slot.m_type, e.type);
        EXPECT_EQ(e.slot.m_length, 8);
        EXPECT_EQ(e.slot.m_family, 1);
        EXPECT_EQ(e.slot.m_address, e.address);
        EXPECT_EQ(e.slot.m_port, e.port);
    }
    EXPECT_EQ(m.m_reflectedFrom.m_type, 0);
    EXPECT_TRUE(m.HasMandatoryAttributes());
}

TEST(STUNMessageDecode, KeepsTheRightValues) {
    CSTUNMessage m;

    // The later of two MAPPED-ADDRESS attributes wins.
    ASSERT_TRUE(DecodeExact(
        m, Response().Address(0x0001, 0x0A000001, 1000).Address(0x0001, 0x0A000002, 2000).Build()));
    EXPECT_EQ(m.m_mappedAddress.m_address, 0x0A000002u);
    EXPECT_EQ(m.m_mappedAddress.m_port, 2000);

    // An unknown attribute of odd length is stepped over by its declared length: what follows
    // it must still be found where it is.
    ASSERT_TRUE(DecodeExact(
        m, Response().Attr(0x8022, {'a', 'b', 'c'}).Address(0x0004, 0xC0A80001, 3478).Build()));
    EXPECT_EQ(m.m_sourceAddress.m_type, 0x0004);
    EXPECT_EQ(m.m_sourceAddress.m_address, 0xC0A80001u);
    EXPECT_EQ(m.m_sourceAddress.m_port, 3478);

    // REFLECTED-FROM is read; RESPONSE-ADDRESS and CHANGE-REQUEST are not.
    ASSERT_TRUE(DecodeExact(m, Response()
                                   .Address(0x0002, 0x01010101, 11)
                                   .Attr(0x0003, {0, 0, 0, 6})
                                   .Address(0x000B, 0x02020202, 22)
                                   .Build()));
    EXPECT_EQ(m.m_responseAddress.m_type, 0);
    EXPECT_EQ(m.m_changeRequest.m_type, 0);
    EXPECT_EQ(m.m_reflectedFrom.m_type, 0x000B);
    EXPECT_EQ(m.m_reflectedFrom.m_address, 0x02020202u);
    EXPECT_EQ(m.m_reflectedFrom.m_port, 22);
    // Nothing of the previous parse survives.
    EXPECT_EQ(m.m_sourceAddress.m_type, 0);
    EXPECT_FALSE(m.HasMandatoryAttributes());

    // An address attribute always takes 8 value bytes and 12 in all, whatever it declares:
    // declared 0 with an address behind it, then a CHANGED-ADDRESS right after those 12 bytes.
    ASSERT_TRUE(DecodeExact(m, Response()
                                   .Raw(0x0001, 0, Response::AddressValue(0x03030303, 33))
                                   .Address(0x0005, 0x04040404, 44)
                                   .Build()));
    EXPECT_EQ(m.m_mappedAddress.m_length, 0);
    EXPECT_EQ(m.m_mappedAddress.m_address, 0x03030303u);
    EXPECT_EQ(m.m_changedAddress.m_address, 0x04040404u);
    EXPECT_EQ(m.m_changedAddress.m_port, 44);
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
        if (missing == 0) {
            // Presence compares each slot with its own code, not just with non-zero.
            m.m_sourceAddress.m_type = stun::STUN_MAPPED_ADDRESS;
            EXPECT_FALSE(m.HasMandatoryAttributes());
        }
    }
}

// Cutting the stund answer anywhere, with the header length made to match the cut, is accepted
// exactly at attribute boundaries; with the original header length only the whole datagram is.
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
        const bool atBoundary =
            std::find(boundaries.begin(), boundaries.end(), cut) != boundaries.end();
        EXPECT_EQ(DecodeExact(m, part), atBoundary);
    }
}

// Random and half-plausible datagrams: nothing may be read outside the buffer (ASan), and an
// accepted parse only ever comes with a matching header length.
TEST(STUNMessageDecode, SurvivesRandomInput) {
    std::mt19937 rng(20240611);
    const uint16_t types[] = {0x0001, 0x0002, 0x0003, 0x0004, 0x0005, 0x000B, 0x0020, 0x8022};
    int accepted = 0;
    for (int i = 0; i < 20000; ++i) {
        Bytes b;
        if (i % 2 == 0) {
            b.resize(rng() % 80);
            for (uint8_t& x : b) {
                x = static_cast<uint8_t>(rng());
            }
        } else {
            // A right header with attributes whose lengths are often a little off.
            Response r;
            const int count = static_cast<int>(rng() % 5);
            for (int k = 0; k < count; ++k) {
                const uint16_t type = types[rng() % 8];
                const size_t size = rng() % 14;
                const int skew = rng() % 4 == 0 ? static_cast<int>(rng() % 5) - 2 : 0;
                r.Raw(type, static_cast<uint16_t>(std::max(0, static_cast<int>(size) + skew)),
                      Bytes(size, static_cast<uint8_t>(rng())));
            }
            b = r.Build();
        }
        CSTUNMessage m;
        const bool ok = DecodeExact(m, b);
        if (ok) {
            ++accepted;
            ASSERT_GT(b.size(), 20u);
            ASSERT_EQ(static_cast<size_t>((b[2] << 8) | b[3]), b.size() - 20);
        }
    }
    RecordProperty("accepted", accepted);
    // The structured half must reach deep into the parser, not bounce off the header.
    EXPECT_GT(accepted, 1000);
}

// ---------------------------------------------------------------------------------------------
// Log lines

class LogCapture {
  public:
    explicit LogCapture(int level) {
        foundation::Logger().Initialize(std::nullopt, std::nullopt, std::nullopt, level, true);
        platform::SetDebugOutputSink([this](std::string_view line) {
            std::lock_guard<std::mutex> lock(mutex_);
            if (line.find("CSTUNMessage::RecvFrom") != std::string_view::npos) {
                lines_.emplace_back(line);
            }
        });
    }
    ~LogCapture() {
        platform::SetDebugOutputSink(nullptr);
        foundation::Logger().SetEnabled(false);
    }
    std::vector<std::string> Lines() {
        std::lock_guard<std::mutex> lock(mutex_);
        return lines_;
    }

  private:
    std::mutex mutex_;
    std::vector<std::string> lines_;
};

TEST(STUNMessageDecode, LogsEachAddressAttributeAtInfo) {
    const Bytes datagram = Response()
                               .Address(0x0001, 0x01020304, 5)
                               .Attr(0x8022, {'s'})
                               .Address(0x0004, 0x0A000001, 3478)
                               .Address(0x0005, 0x0A000002, 3479)
                               .Address(0x000B, 0xC0A80001, 65535)
                               .Build();
    const std::vector<std::string> expected = {
        "CSTUNMessage::RecvFrom STUN_MAPPED_ADDRESS: 1.2.3.4:5\n",
        "CSTUNMessage::RecvFrom STUN_SOURCE_ADDRESS: 10.0.0.1:3478\n",
        "CSTUNMessage::RecvFrom STUN_CHANGED_ADDRESS: 10.0.0.2:3479\n",
        "CSTUNMessage::RecvFrom STUN_REFLECTED_FROM: 192.168.0.1:65535\n",
    };
    {
        LogCapture capture(foundation::kLogInfo);
        CSTUNMessage m;
        ASSERT_TRUE(DecodeExact(m, datagram));
        const std::vector<std::string> lines = capture.Lines();
        ASSERT_EQ(lines.size(), expected.size());
        for (size_t i = 0; i < lines.size(); ++i) {
            SCOPED_TRACE(lines[i]);
            EXPECT_NE(lines[i].find(", INFO"), std::string::npos);
            ASSERT_GE(lines[i].size(), expected[i].size());
            EXPECT_EQ(lines[i].substr(lines[i].size() - expected[i].size()), expected[i]);
        }
    }
    {
        LogCapture capture(foundation::kLogWarn);
        CSTUNMessage m;
        ASSERT_TRUE(DecodeExact(m, datagram));
        EXPECT_TRUE(capture.Lines().empty());
    }
}

// ---------------------------------------------------------------------------------------------
// Socket wrappers

class LoopbackSocket {
  public:
    LoopbackSocket() : s_(foundation::CreateUdpSocket(kLoopback, &port_)) {}
    ~LoopbackSocket() { platform::CloseSocket(s_); }
    LoopbackSocket(const LoopbackSocket&) = delete;
    LoopbackSocket& operator=(const LoopbackSocket&) = delete;
    platform::SocketHandle Get() const { return s_; }
    uint16_t Port() const { return port_; }

  private:
    uint16_t port_ = 0;
    platform::SocketHandle s_;
};

TEST(STUNMessageSocket, RecvFromTakesAtMost1024Bytes) {
    LoopbackSocket client;
    LoopbackSocket server;
    ASSERT_NE(client.Get(), platform::kInvalidSocket);
    ASSERT_NE(server.Get(), platform::kInvalidSocket);

    struct Case {
        size_t size;
        bool accepted;
    };
    for (const Case& c : {Case{1024, true}, Case{1025, false}, Case{20, false}}) {
        SCOPED_TRACE(c.size);
        Response r;
        if (c.size > 20) {
            r.Address(0x0001, 0x01020304, 5).Attr(0x8022, Bytes(c.size - 20 - 12 - 4, 'p'));
        }
        const Bytes datagram = r.Build();
        ASSERT_EQ(datagram.size(), c.size);
        ASSERT_EQ(platform::SendTo(server.Get(), datagram.data(), datagram.size(), kLoopback,
                                   client.Port()),
                  static_cast<int>(c.size));
        CSTUNMessage m;
        uint32_t from = 0;
        uint16_t fromPort = 0;
        EXPECT_EQ(m.RecvFrom(client.Get(), from, fromPort, 2000), c.accepted);
        if (c.accepted) {
            EXPECT_EQ(from, kLoopback);
            EXPECT_EQ(fromPort, server.Port());
            EXPECT_EQ(m.m_mappedAddress.m_address, 0x01020304u);
        }
    }

    // Nothing queued: a time-out, the sender untouched, and a fresh id after the reset.
    CSTUNMessage m;
    const Bytes before(m.m_transactionId, m.m_transactionId + 16);
    uint32_t from = 0xDEADBEEF;
    uint16_t fromPort = 7;
    EXPECT_FALSE(m.RecvFrom(client.Get(), from, fromPort, 50));
    EXPECT_EQ(from, 0xDEADBEEF);
    EXPECT_EQ(fromPort, 7);
    EXPECT_NE(Bytes(m.m_transactionId, m.m_transactionId + 16), before);
}

}  // namespace
