// The two STUN transactions over loopback: the real stund for real answers, the fake for silence,
// wrong ids, malformed answers and misplaced senders. Only the two "no answer" cases take their
// full 4.7 s and 9.5 s schedules: a wrong answer ends an attempt at once.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstring>
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
using testsupport::FakeStunServer;
using testsupport::kLoopback;
using testsupport::Put16;
using testsupport::Stund;
using Bytes = std::vector<uint8_t>;
using Clock = std::chrono::steady_clock;

// TEST-NET-1: never an address of this host, so binding to it fails before anything is sent.
constexpr uint32_t kForeignAddress = 0xC0000201;

int64_t MsSince(Clock::time_point start) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
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

// Header of a Binding Request with this length and the id of a captured request.
Bytes RequestHeader(uint16_t length, const Bytes& captured) {
    Bytes b = {0, 1};
    Put16(b, length);
    b.insert(b.end(), captured.begin() + 4, captured.begin() + 20);
    return b;
}

// All requests identical (so one transaction id), sent on the retransmission schedule. Arrival
// times carry the fake thread's wake-up jitter, hence the margins.
void ExpectSchedule(const std::vector<FakeStunServer::Request>& requests, size_t size,
                    const std::vector<int>& waitsMs) {
    ASSERT_EQ(requests.size(), waitsMs.size());
    int64_t total = 0;
    for (size_t i = 0; i < requests.size(); ++i) {
        SCOPED_TRACE("request " + std::to_string(i + 1));
        EXPECT_EQ(requests[i].bytes.size(), size);
        EXPECT_EQ(requests[i].bytes, requests.front().bytes);
        if (i > 0) {
            const int64_t gap = static_cast<int64_t>(requests[i].tickMs - requests[i - 1].tickMs);
            EXPECT_GE(gap, waitsMs[i - 1] - 30);
            EXPECT_LE(gap, waitsMs[i - 1] + 150);
            total += waitsMs[i - 1];
        }
    }
    EXPECT_GE(static_cast<int64_t>(requests.back().tickMs - requests.front().tickMs), total - 30);
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

void ExpectNoAnswerSchedule(bool responseAddress) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    fake.SetMode(FakeStunServer::Mode::kSilent);
    const Clock::time_point start = Clock::now();
    EXPECT_FALSE(responseAddress ? RunResponseAddressTest(fake.Port()) : RunTest(fake.Port()).ok);
    const int64_t elapsed = MsSince(start);
    EXPECT_GE(elapsed, responseAddress ? 9500 : 4700);
    EXPECT_LE(elapsed, responseAddress ? 10500 : 5500);
    std::vector<int> waits = {100, 200, 400, 800, 1600, 1600};
    if (responseAddress) {
        waits.insert(waits.end(), {1600, 1600, 1600});
    }
    ExpectSchedule(fake.Requests(), responseAddress ? 40 : 20, waits);
}

TEST(STUNTransactionFake, NoAnswerSendsSixRequestsOnTheSchedule) {
    ExpectNoAnswerSchedule(false);
}

TEST(STUNTransactionFake, ResponseAddressNoAnswerSendsNineRequestsOnTheSchedule) {
    ExpectNoAnswerSchedule(true);
}

// Each unusable answer costs an attempt at once, so all attempts pass in a moment. The codec's
// refusals are tested on their own; a bare header stands for all of them.
TEST(STUNTransactionFake, UnusableAnswersExhaustTheAttemptsQuickly) {
    Bytes headerOnly(20, 0);
    headerOnly[0] = 0x01;
    headerOnly[1] = 0x01;
    for (const auto& [name, raw, responseAddress] :
         {std::tuple{"wrong transaction id", false, false}, std::tuple{"header only", true, false},
          std::tuple{"response address, wrong id", false, true}}) {
        SCOPED_TRACE(name);
        FakeStunServer fake;
        ASSERT_TRUE(fake.IsRunning());
        if (raw) {
            fake.SetRawAnswer(headerOnly);
        } else {
            fake.SetMode(FakeStunServer::Mode::kWrongTransactionId);
        }
        const int descriptors = platform::CountOpenDescriptors();
        const Clock::time_point start = Clock::now();
        RunResult r;
        if (responseAddress) {
            EXPECT_FALSE(RunResponseAddressTest(fake.Port()));
        } else {
            r = RunTest(fake.Port());
            EXPECT_FALSE(r.ok);
            // The sender of the last datagram is reported even when it was refused.
            EXPECT_EQ(std::make_pair(r.fromAddress, r.fromPort),
                      std::make_pair(kLoopback, fake.Port()));
        }
        EXPECT_LT(MsSince(start), 1000);
        const auto requests = fake.Requests();
        ASSERT_EQ(requests.size(), responseAddress ? 9u : 6u);
        for (const FakeStunServer::Request& q : requests) {
            EXPECT_EQ(q.bytes, requests.front().bytes);
        }
        EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
    }
}

TEST(STUNTransactionFake, AcceptsTheFirstAnswerWithTheRequestsId) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    fake.SetMappedPort(40123);
    fake.SetChangedAddress(0x7F000063, 3479);
    RunResult r = RunTest(fake.Port());
    ASSERT_TRUE(r.ok);
    EXPECT_EQ(fake.RequestCount(), 1);
    EXPECT_EQ(std::memcmp(r.response.m_transactionId, fake.LastRequest().bytes.data() + 4, 16), 0);
    const CSTUNMessage& m = r.response;
    EXPECT_EQ(std::make_tuple(m.m_mappedAddress.m_address, m.m_mappedAddress.m_port,
                              m.m_changedAddress.m_address, m.m_changedAddress.m_port,
                              r.fromAddress, r.fromPort),
              std::make_tuple(kLoopback, uint16_t{40123}, 0x7F000063u, uint16_t{3479}, kLoopback,
                              fake.Port()));

    // Missing attributes are the caller's business: the transaction itself succeeds.
    fake.SetMode(FakeStunServer::Mode::kNoChangedAddress);
    r = RunTest(fake.Port());
    ASSERT_TRUE(r.ok);
    EXPECT_FALSE(r.response.HasMandatoryAttributes());
    EXPECT_EQ(r.response.m_changedAddress.m_type, 0);
}

TEST(STUNTransactionFake, ChangeFlagsGoOnTheWire) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    for (const auto& [changeIp, changePort, flags] :
         {std::tuple{false, false, 0}, std::tuple{true, false, 4}, std::tuple{false, true, 2},
          std::tuple{true, true, 6}}) {
        SCOPED_TRACE(flags);
        ASSERT_TRUE(RunTest(fake.Port(), kLoopback, changeIp, changePort).ok);
        const Bytes b = fake.LastRequest().bytes;
        ASSERT_GE(b.size(), 20u);
        Bytes expected = RequestHeader(flags == 0 ? 0 : 8, b);
        if (flags != 0) {  // no CHANGE-REQUEST at all without flags
            for (int w : {3, 4, 0, flags}) {
                Put16(expected, static_cast<uint16_t>(w));
            }
        }
        EXPECT_EQ(b, expected);
    }
}

TEST(STUNTransactionFake, LocalPortArgument) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    // Absent: a rotating port, not reported.
    ASSERT_TRUE(RunTest(fake.Port()).ok);
    EXPECT_GE(fake.LastRequest().fromPort, 10000);
    EXPECT_LE(fake.LastRequest().fromPort, 60000);
    // Present and 0: a rotating port, written back.
    uint16_t reported = 0;
    ASSERT_TRUE(RunTest(fake.Port(), kLoopback, false, false, &reported).ok);
    EXPECT_EQ(reported, fake.LastRequest().fromPort);

    // Present and not 0: exactly that port, left as it was. Borrow a free one first.
    uint16_t exact = 0;
    platform::Socket probe = foundation::CreateUdpSocket(kLoopback, &exact);
    ASSERT_TRUE(probe);
    probe.Close();
    uint16_t asked = exact;
    ASSERT_TRUE(RunTest(fake.Port(), kLoopback, false, false, &asked).ok);
    EXPECT_EQ(asked, exact);
    EXPECT_EQ(fake.LastRequest().fromPort, exact);

    // A taken port fails at once, without sending, and no other port is tried.
    probe = foundation::CreateUdpSocket(kLoopback, &exact);
    ASSERT_TRUE(probe);
    const int before = fake.RequestCount();
    asked = exact;
    EXPECT_FALSE(RunTest(fake.Port(), kLoopback, false, false, &asked).ok);
    EXPECT_EQ(asked, exact);
    probe.Close();
    // No local address to bind at all: the same, for both transactions.
    CSTUNMessage response;
    uint32_t from = 0;
    uint16_t fromPort = 0;
    const int descriptors = platform::CountOpenDescriptors();
    EXPECT_FALSE(stun::STUN_RunTest(kForeignAddress, nullptr, kLoopback, fake.Port(), false, false,
                                    response, from, fromPort));
    EXPECT_FALSE(
        stun::STUN_RunResponseAddressTest(kForeignAddress, kLoopback, fake.Port(), kLoopback));
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
    EXPECT_FALSE(fake.WaitForRequests(before + 1, 200));
}

// The answer must reach the silent socket from an address and a port that both differ from the
// server's; anything else proves nothing about filtering.
TEST(STUNTransactionFake, ResponseAddressSenderMustDifferInAddressAndPort) {
    for (const auto& [otherAddress, otherPort] : {std::pair{false, false}, std::pair{false, true},
                                                  std::pair{true, false}, std::pair{true, true}}) {
        SCOPED_TRACE(testing::Message()
                     << "otherAddress=" << otherAddress << " otherPort=" << otherPort);
        FakeStunServer fake;
        ASSERT_TRUE(fake.IsRunning());
        if (otherAddress || otherPort) {
            ASSERT_TRUE(fake.AnswerFrom(otherAddress ? 0x7F000002 : kLoopback,
                                        otherPort ? 0 : fake.Port()));
        }
        const int descriptors = platform::CountOpenDescriptors();
        EXPECT_EQ(RunResponseAddressTest(fake.Port()), otherAddress && otherPort);
        EXPECT_EQ(fake.RequestCount(), 1);
        EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);

        // CHANGE-REQUEST (change both) first, then RESPONSE-ADDRESS naming our other socket.
        const FakeStunServer::Request request = fake.LastRequest();
        ASSERT_EQ(request.bytes.size(), 40u);
        const uint16_t listenPort =
            static_cast<uint16_t>(request.bytes[34] << 8 | request.bytes[35]);
        EXPECT_NE(listenPort, request.fromPort);
        Bytes expected = RequestHeader(20, request.bytes);
        for (uint16_t w : {3, 4, 0, 6, 2, 8, 1}) {
            Put16(expected, w);
        }
        Put16(expected, listenPort);
        Put16(expected, 0x7F00);
        Put16(expected, 1);
        EXPECT_EQ(request.bytes, expected);
    }
}

// The owner's stop request ends a transaction at once: no further attempts, sockets closed.
TEST(STUNTransactionFake, StopRequestEndsTheTransaction) {
    for (bool responseAddress : {false, true}) {
        SCOPED_TRACE(responseAddress ? "response address" : "binding");
        FakeStunServer fake;
        ASSERT_TRUE(fake.IsRunning());
        fake.SetMode(FakeStunServer::Mode::kSilent);
        const int descriptors = platform::CountOpenDescriptors();
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
        EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
        // Attempts at 0, 100 and 300 ms before the stop at about 400 ms, and none after it.
        const int sent = fake.RequestCount();
        EXPECT_LE(sent, 3);
        EXPECT_FALSE(fake.WaitForRequests(sent + 1, 300));
    }
}

}  // namespace
