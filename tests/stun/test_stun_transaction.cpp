// The STUN transaction: its schedule and response matching as tables, with no sockets and no
// waiting; then the socket driver against the real stund, one real-time give-up of each kind, and
// the owner's stop.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "foundation/NetUtils.h"
#include "platform/kernel.h"
#include "platform/net.h"
#include "stun/STUNMessage.h"
#include "stun/STUNTransaction.h"
#include "tests/support/FakeStunServer.h"
#include "tests/support/StunBytes.h"
#include "tests/support/Stund.h"

namespace {

using stun::CSTUNMessage;
using stun::CSTUNTransaction;
using stun::STUNSend;
using testsupport::FakeStunServer;
using testsupport::kLoopback;
using testsupport::Put16;
using testsupport::PutAddress;
using testsupport::Stund;
using Bytes = std::vector<uint8_t>;
using Clock = std::chrono::steady_clock;
using Verdict = CSTUNTransaction::Verdict;

constexpr uint32_t kServer = 0x0A000001;
constexpr uint16_t kServerPort = 3478;

int64_t MsSince(Clock::time_point start) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
}

Bytes BytesOf(const STUNSend& send) {
    return Bytes(send.bytes.begin(), send.bytes.end());
}

// A Binding Response (or whatever type) with the given id, MAPPED-ADDRESS carrying mappedPort.
Bytes Answer(const uint8_t* id, uint16_t mappedPort = 40000, uint16_t type = 0x0101) {
    Bytes b;
    Put16(b, type);
    Put16(b, 12);
    b.insert(b.end(), id, id + 16);
    PutAddress(b, stun::STUN_MAPPED_ADDRESS, 0xC0A80001, mappedPort);
    return b;
}

TEST(STUNTransactionSchedule, RetransmitsTheSameBytesOnTheDoublingWaitThenGivesUp) {
    for (const auto& [attempts, waits] :
         {std::pair{stun::kSTUNRunTestAttempts, std::vector<int>{100, 200, 400, 800, 1600, 1600}},
          std::pair{stun::kSTUNResponseAddressAttempts,
                    std::vector<int>{100, 200, 400, 800, 1600, 1600, 1600, 1600, 1600}}}) {
        SCOPED_TRACE(attempts);
        const CSTUNMessage request = stun::MakeBindingRequest(false, false);
        CSTUNTransaction t(request, attempts);
        uint64_t now = 5000;
        std::optional<STUNSend> send = t.Start(now);
        ASSERT_TRUE(send);
        const Bytes first = BytesOf(*send);
        std::vector<int> seen;
        while (send) {
            EXPECT_EQ(BytesOf(*send), first);
            EXPECT_EQ(t.Deadline(), send->deadlineMs);
            seen.push_back(static_cast<int>(send->deadlineMs - now));
            now = send->deadlineMs;
            send = t.OnTimeout(now);
        }
        EXPECT_EQ(seen, waits);
        EXPECT_FALSE(t.OnTimeout(now));
        // An answer after giving up is too late.
        const Bytes late = Answer(request.m_transactionId);
        EXPECT_EQ(t.OnDatagram(now, late.data(), late.size(), kServer, kServerPort),
                  Verdict::kIgnored);
        EXPECT_FALSE(t.IsAccepted());
    }
}

// One datagram per row, into a transaction started at 0 whose first attempt has timed out once
// when the row says so. Only a decodable datagram with the request's id is accepted, whatever
// its type, attributes or sender, and only once; anything else ends the attempt at once.
TEST(STUNTransactionMatching, AcceptsOnlyTheRequestsIdAndEndsTheAttemptOnAnythingElse) {
    const CSTUNMessage request = stun::MakeBindingRequest(true, false);
    const uint8_t* id = request.m_transactionId;
    uint8_t otherId[16];
    std::memcpy(otherId, id, 16);
    otherId[15] ^= 1;
    Bytes headerOnly = Answer(id);
    headerOnly.resize(20);
    headerOnly[3] = 0;
    Bytes lengthOff = Answer(id);
    lengthOff[3] = 13;
    const struct {
        const char* name;
        Bytes datagram;
        bool afterRetransmit;
        Verdict verdict;
    } rows[] = {
        {"answer to the first attempt", Answer(id), false, Verdict::kAccepted},
        {"answer to the first attempt arriving in the second", Answer(id), true,
         Verdict::kAccepted},
        {"error response with the id", Answer(id, 40000, 0x0111), false, Verdict::kAccepted},
        {"foreign id", Answer(otherId), false, Verdict::kIgnored},
        {"header only", headerOnly, false, Verdict::kIgnored},
        {"length one off", lengthOff, false, Verdict::kIgnored},
        {"empty", Bytes{}, false, Verdict::kIgnored},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        CSTUNTransaction t(request, stun::kSTUNRunTestAttempts);
        ASSERT_TRUE(t.Start(0));
        uint64_t now = 40;
        if (row.afterRetransmit) {
            ASSERT_TRUE(t.OnTimeout(100));
            now = 150;
        }
        const uint64_t deadline = t.Deadline();
        EXPECT_EQ(t.OnDatagram(now, row.datagram.data(), row.datagram.size(), 0x0A000002, 3479),
                  row.verdict);
        EXPECT_EQ(t.IsAccepted(), row.verdict == Verdict::kAccepted);
        if (row.verdict == Verdict::kAccepted) {
            // A duplicate, even from elsewhere and saying otherwise, changes nothing.
            const Bytes duplicate = Answer(id, 2222);
            EXPECT_EQ(t.OnDatagram(now, duplicate.data(), duplicate.size(), kServer, kServerPort),
                      Verdict::kIgnored);
            EXPECT_EQ(std::make_tuple(t.AnswerAddress(), t.AnswerPort(),
                                      t.Response().m_mappedAddress.m_port),
                      std::make_tuple(0x0A000002u, uint16_t{3479}, uint16_t{40000}));
            EXPECT_EQ(std::memcmp(t.Response().m_transactionId, id, 16), 0);
            EXPECT_EQ(t.Deadline(), deadline);
            EXPECT_FALSE(t.OnTimeout(now)) << "an answered transaction sends nothing more";
        } else {
            // The attempt is over now; the next one waits twice as long from here.
            EXPECT_EQ(t.Deadline(), now);
            const std::optional<STUNSend> next = t.OnTimeout(now);
            ASSERT_TRUE(next);
            EXPECT_EQ(next->deadlineMs, now + (row.afterRetransmit ? 400 : 200));
        }
    }
}

TEST(STUNTransactionRequests, WireBytesOfEachRequest) {
    const auto header = [](uint16_t length, const CSTUNMessage& m) {
        Bytes b = {0, 1};
        Put16(b, length);
        b.insert(b.end(), m.m_transactionId, m.m_transactionId + 16);
        return b;
    };
    for (const auto& [changeIp, changePort, flags] :
         {std::tuple{false, false, 0}, std::tuple{true, false, 4}, std::tuple{false, true, 2},
          std::tuple{true, true, 6}}) {
        SCOPED_TRACE(flags);
        const CSTUNMessage request = stun::MakeBindingRequest(changeIp, changePort);
        Bytes expected = header(flags == 0 ? 0 : 8, request);
        if (flags != 0) {  // no CHANGE-REQUEST at all without flags
            for (int w : {3, 4, 0, flags}) {
                Put16(expected, static_cast<uint16_t>(w));
            }
        }
        CSTUNTransaction t(request, 1);
        EXPECT_EQ(BytesOf(*t.Start(0)), expected);
    }
    // CHANGE-REQUEST (change both) first, then RESPONSE-ADDRESS naming the listening socket.
    const CSTUNMessage request = stun::MakeResponseAddressRequest(0x7F000002, 45678);
    Bytes expected = header(20, request);
    for (uint16_t w : {3, 4, 0, 6, 2, 8, 1, 45678, 0x7F00, 2}) {
        Put16(expected, w);
    }
    CSTUNTransaction t(request, 1);
    EXPECT_EQ(BytesOf(*t.Start(0)), expected);
}

TEST(STUNTransactionRequests, ResponseAddressAnswerMustDifferInAddressAndPort) {
    for (const auto& [address, port, elsewhere] :
         {std::tuple{kServer, kServerPort, false}, std::tuple{kServer, uint16_t{3479}, false},
          std::tuple{0x0A000002u, kServerPort, false},
          std::tuple{0x0A000002u, uint16_t{3479}, true}}) {
        EXPECT_EQ(stun::IsAnswerFromElsewhere(address, port, kServer, kServerPort), elsewhere)
            << address << ":" << port;
    }
}

struct RunResult {
    bool ok = false;
    CSTUNMessage response;
    uint32_t fromAddress = 0;
    uint16_t fromPort = 0;
};

RunResult RunTest(uint16_t serverPort, uint32_t serverAddress = kLoopback, bool changeIp = false,
                  bool changePort = false, uint16_t* localPort = nullptr) {
    RunResult r;
    r.ok = stun::STUN_RunTest(kLoopback, localPort, serverAddress, serverPort, changeIp, changePort,
                              r.response, r.fromAddress, r.fromPort);
    return r;
}

bool RunResponseAddressTest(uint16_t serverPort, uint32_t server = kLoopback) {
    return stun::STUN_RunResponseAddressTest(kLoopback, server, serverPort, kLoopback);
}

class STUNTransactionStund : public testsupport::StundTest {};

TEST_F(STUNTransactionStund, AnswersComeFromTheAddressAndPortAskedFor) {
    const uint32_t a1 = stund_.PrimaryAddress();
    const uint32_t a2 = stund_.AlternateAddress();
    const uint16_t p1 = Stund::kPrimaryPort;
    const uint16_t p2 = Stund::kAlternatePort;
    for (const auto& [changeIp, changePort, fromAddress, fromPort] :
         {std::tuple{false, false, a1, p1}, std::tuple{false, true, a1, p2},
          std::tuple{true, false, a2, p1}, std::tuple{true, true, a2, p2}}) {
        SCOPED_TRACE(testing::Message() << "changeIp=" << changeIp << " changePort=" << changePort);
        uint16_t localPort = 0;
        RunResult r = RunTest(p1, a1, changeIp, changePort, &localPort);
        ASSERT_TRUE(r.ok);
        ASSERT_NE(localPort, 0);
        EXPECT_EQ(r.fromAddress, fromAddress);
        EXPECT_EQ(r.fromPort, fromPort);
        const CSTUNMessage& m = r.response;
        EXPECT_TRUE(m.HasMandatoryAttributes());
        EXPECT_EQ(std::make_tuple(m.m_mappedAddress.m_address, m.m_mappedAddress.m_port,
                                  m.m_sourceAddress.m_address, m.m_sourceAddress.m_port,
                                  m.m_changedAddress.m_address, m.m_changedAddress.m_port),
                  std::make_tuple(kLoopback, localPort, fromAddress, fromPort, a2, p2));
    }
    // Nothing filters on loopback, so the answer to the second socket gets through.
    EXPECT_TRUE(RunResponseAddressTest(p1, a1));
}

// The one check of the schedule in real time: all attempts go out and the whole wait passes.
void ExpectRealTimeGiveUp(bool responseAddress) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    fake.SetMode(FakeStunServer::Mode::kSilent);
    const Clock::time_point start = Clock::now();
    EXPECT_FALSE(responseAddress ? RunResponseAddressTest(fake.Port()) : RunTest(fake.Port()).ok);
    const int64_t elapsed = MsSince(start);
    EXPECT_GE(elapsed, responseAddress ? 9500 : 4700);
    EXPECT_LE(elapsed, responseAddress ? 10500 : 5500);
    EXPECT_EQ(fake.RequestCount(), responseAddress ? 9 : 6);
}

TEST(STUNTransactionRealTime, NoAnswerGivesUpAfterSixRequestsOrNineForResponseAddress) {
    ExpectRealTimeGiveUp(false);
    ExpectRealTimeGiveUp(true);
}

// No local address to bind: both fail before sending.
TEST(STUNTransactionSockets, NoSocketFailsAtOnce) {
    constexpr uint32_t kForeignAddress = 0xC0000201;  // TEST-NET-1, never this host's
    RunResult r;
    EXPECT_FALSE(stun::STUN_RunTest(kForeignAddress, nullptr, kLoopback, 9, false, false,
                                    r.response, r.fromAddress, r.fromPort));
    EXPECT_FALSE(stun::STUN_RunResponseAddressTest(kForeignAddress, kLoopback, 9, kLoopback));
}

// The owner's stop request ends a transaction at once: no further attempts, sockets closed.
TEST(STUNTransactionSockets, StopRequestEndsTheTransaction) {
    for (bool responseAddress : {false, true}) {
        SCOPED_TRACE(responseAddress ? "response address" : "binding");
        FakeStunServer fake;
        ASSERT_TRUE(fake.IsRunning());
        fake.SetMode(FakeStunServer::Mode::kSilent);
        std::atomic<int> result{-1};
        {
            platform::Thread worker;
            ASSERT_TRUE(worker.Start([&] {
                result = (responseAddress ? RunResponseAddressTest(fake.Port())
                                          : RunTest(fake.Port()).ok)
                             ? 1
                             : 0;
            }));
            ASSERT_TRUE(fake.WaitForRequests(2, 1000));
            std::this_thread::sleep_for(std::chrono::milliseconds(300));
            const Clock::time_point stop = Clock::now();
            worker.Stop();
            EXPECT_LT(MsSince(stop), 200);
        }
        EXPECT_EQ(result.load(), 0);
        // Attempts at 0, 100 and 300 ms before the stop at about 400 ms, and none after it.
        const int sent = fake.RequestCount();
        EXPECT_LE(sent, 3);
        EXPECT_FALSE(fake.WaitForRequests(sent + 1, 300));
    }
}

}  // namespace
