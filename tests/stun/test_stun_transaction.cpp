// The two STUN transactions over loopback: against the real stund for the answers a server gives,
// and against the fake for silence, wrong ids, malformed answers and misplaced senders. The two
// "no answer" cases take the full 4.7 s and 9.5 s schedules; everything else ends in well under
// a second because a wrong answer ends an attempt at once.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "foundation/NetUtils.h"
#include "platform/kernel.h"
#include "platform/net.h"
#include "stun/STUNMessage.h"
#include "stun/STUNTransaction.h"
#include "tests/support/FakeStunServer.h"
#include "tests/support/Stund.h"

namespace {

using stun::CSTUNMessage;
using stun::STUN_RunResponseAddressTest;
using stun::STUN_RunTest;
using testsupport::FakeStunServer;
using testsupport::kLoopback;
using Clock = std::chrono::steady_clock;

constexpr uint32_t kLoopback2 = 0x7F000002;
// TEST-NET-1: never an address of this host, so binding to it fails before anything is sent.
constexpr uint32_t kForeignAddress = 0xC0000201;

int64_t MsSince(Clock::time_point start) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
}

uint16_t Read16(const std::vector<uint8_t>& b, size_t at) {
    return static_cast<uint16_t>((b[at] << 8) | b[at + 1]);
}

uint32_t Read32(const std::vector<uint8_t>& b, size_t at) {
    return (static_cast<uint32_t>(Read16(b, at)) << 16) | Read16(b, at + 2);
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
    r.ok = STUN_RunTest(kLoopback, localPort, serverAddress, serverPort, changeIp, changePort,
                        r.response, r.fromAddress, r.fromPort);
    return r;
}

// Every request of one call carries the same bytes (and so the same transaction id).
void ExpectIdenticalRequests(const std::vector<FakeStunServer::Request>& requests, size_t size) {
    ASSERT_FALSE(requests.empty());
    for (const FakeStunServer::Request& r : requests) {
        EXPECT_EQ(r.bytes.size(), size);
        EXPECT_EQ(r.bytes, requests.front().bytes);
    }
}

// Gaps between the arrivals of consecutive requests against the retransmission schedule. The
// arrival times carry the fake thread's wake-up jitter (a few ms, more under sanitizers and a
// busy machine), hence the margins; 100 vs 200 ms and the like stay far apart.
void ExpectSchedule(const std::vector<FakeStunServer::Request>& requests,
                    const std::vector<int>& waitsMs) {
    ASSERT_EQ(requests.size(), waitsMs.size());
    int64_t total = 0;
    for (size_t i = 1; i < requests.size(); ++i) {
        SCOPED_TRACE("gap before request " + std::to_string(i + 1));
        const int64_t gap = static_cast<int64_t>(requests[i].tickMs - requests[i - 1].tickMs);
        EXPECT_GE(gap, waitsMs[i - 1] - 30);
        EXPECT_LE(gap, waitsMs[i - 1] + 150);
        total += waitsMs[i - 1];
    }
    EXPECT_GE(static_cast<int64_t>(requests.back().tickMs - requests.front().tickMs), total - 30);
}

// ---------------------------------------------------------------------------------------------
// Against the real stund

class STUNTransactionStund : public testsupport::StundTest {};

TEST_F(STUNTransactionStund, PlainTestReportsOurAddressAndTheServerPair) {
    uint16_t localPort = 0;
    RunResult r = RunTest(testsupport::Stund::kPrimaryPort, stund_.PrimaryAddress(), false, false,
                          &localPort);
    ASSERT_TRUE(r.ok);
    ASSERT_NE(localPort, 0);

    EXPECT_EQ(r.fromAddress, stund_.PrimaryAddress());
    EXPECT_EQ(r.fromPort, testsupport::Stund::kPrimaryPort);
    ASSERT_TRUE(r.response.HasMandatoryAttributes());
    EXPECT_EQ(r.response.m_mappedAddress.m_address, kLoopback);
    EXPECT_EQ(r.response.m_mappedAddress.m_port, localPort);
    EXPECT_EQ(r.response.m_sourceAddress.m_address, stund_.PrimaryAddress());
    EXPECT_EQ(r.response.m_sourceAddress.m_port, testsupport::Stund::kPrimaryPort);
    EXPECT_EQ(r.response.m_changedAddress.m_address, stund_.AlternateAddress());
    EXPECT_EQ(r.response.m_changedAddress.m_port, testsupport::Stund::kAlternatePort);
}

TEST_F(STUNTransactionStund, ChangeRequestIsAnsweredFromTheOtherAddressOrPort) {
    struct Case {
        bool changeIp;
        bool changePort;
        uint32_t fromAddress;
        uint16_t fromPort;
    };
    const uint32_t a1 = stund_.PrimaryAddress();
    const uint32_t a2 = stund_.AlternateAddress();
    const uint16_t p1 = testsupport::Stund::kPrimaryPort;
    const uint16_t p2 = testsupport::Stund::kAlternatePort;
    for (const Case& c :
         {Case{false, true, a1, p2}, Case{true, false, a2, p1}, Case{true, true, a2, p2}}) {
        SCOPED_TRACE(std::string("changeIp=") + (c.changeIp ? "1" : "0") +
                     " changePort=" + (c.changePort ? "1" : "0"));
        uint16_t localPort = 0;
        RunResult r = RunTest(p1, a1, c.changeIp, c.changePort, &localPort);
        ASSERT_TRUE(r.ok);
        EXPECT_EQ(r.fromAddress, c.fromAddress);
        EXPECT_EQ(r.fromPort, c.fromPort);
        EXPECT_EQ(r.response.m_mappedAddress.m_address, kLoopback);
        EXPECT_EQ(r.response.m_mappedAddress.m_port, localPort);
    }
}

// Nothing filters on loopback, so the answer to the second socket gets through.
TEST_F(STUNTransactionStund, ResponseAddressAnswerArrives) {
    EXPECT_TRUE(STUN_RunResponseAddressTest(kLoopback, stund_.PrimaryAddress(),
                                            testsupport::Stund::kPrimaryPort, kLoopback));
}

// ---------------------------------------------------------------------------------------------
// Against the fake

TEST(STUNTransactionFake, NoAnswerSendsSixRequestsOnTheSchedule) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    fake.SetMode(FakeStunServer::Mode::kSilent);

    const Clock::time_point start = Clock::now();
    const RunResult r = RunTest(fake.Port());
    const int64_t elapsed = MsSince(start);

    EXPECT_FALSE(r.ok);
    EXPECT_GE(elapsed, 4700);
    EXPECT_LE(elapsed, 5500);
    const auto requests = fake.Requests();
    ExpectIdenticalRequests(requests, 20);
    ExpectSchedule(requests, {100, 200, 400, 800, 1600, 1600});
}

TEST(STUNTransactionFake, ResponseAddressNoAnswerSendsNineRequestsOnTheSchedule) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    fake.SetMode(FakeStunServer::Mode::kSilent);

    const Clock::time_point start = Clock::now();
    const bool ok = STUN_RunResponseAddressTest(kLoopback, kLoopback, fake.Port(), kLoopback);
    const int64_t elapsed = MsSince(start);

    EXPECT_FALSE(ok);
    EXPECT_GE(elapsed, 9500);
    EXPECT_LE(elapsed, 10500);
    const auto requests = fake.Requests();
    ExpectIdenticalRequests(requests, 40);
    ExpectSchedule(requests, {100, 200, 400, 800, 1600, 1600, 1600, 1600, 1600});
}

// Answers that cost an attempt each: the wait ends early and the request goes out again, so all
// six attempts pass in a moment.
TEST(STUNTransactionFake, UnusableAnswersExhaustTheAttemptsQuickly) {
    struct Case {
        const char* name;
        FakeStunServer::Mode mode;
        std::vector<uint8_t> raw;
    };
    // The codec's refusals are tested on their own; one stands for all of them here.
    std::vector<uint8_t> headerOnly(20, 0);
    headerOnly[0] = 0x01;
    headerOnly[1] = 0x01;
    const std::vector<Case> cases = {
        {"wrong transaction id", FakeStunServer::Mode::kWrongTransactionId, {}},
        {"header only", FakeStunServer::Mode::kRaw, headerOnly},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        FakeStunServer fake;
        ASSERT_TRUE(fake.IsRunning());
        if (c.mode == FakeStunServer::Mode::kRaw) {
            fake.SetRawAnswer(c.raw);
        } else {
            fake.SetMode(c.mode);
        }
        const int descriptors = platform::CountOpenDescriptors();
        const Clock::time_point start = Clock::now();
        const RunResult r = RunTest(fake.Port());
        EXPECT_FALSE(r.ok);
        EXPECT_LT(MsSince(start), 1000);
        EXPECT_EQ(fake.RequestCount(), 6);
        ExpectIdenticalRequests(fake.Requests(), 20);
        // The sender of the last datagram is reported even when it was refused.
        EXPECT_EQ(r.fromAddress, kLoopback);
        EXPECT_EQ(r.fromPort, fake.Port());
        EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
    }

    // The same for the response-address variant, with its nine attempts.
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    fake.SetMode(FakeStunServer::Mode::kWrongTransactionId);
    const int descriptors = platform::CountOpenDescriptors();
    const Clock::time_point start = Clock::now();
    EXPECT_FALSE(STUN_RunResponseAddressTest(kLoopback, kLoopback, fake.Port(), kLoopback));
    EXPECT_LT(MsSince(start), 1000);
    EXPECT_EQ(fake.RequestCount(), 9);
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
}

TEST(STUNTransactionFake, AcceptsTheFirstAnswerWithTheRequestsId) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    fake.SetMappedPort(40123);
    fake.SetChangedAddress(0x7F000063, 3479);

    uint16_t localPort = 0;
    RunResult r = RunTest(fake.Port(), kLoopback, false, false, &localPort);
    ASSERT_TRUE(r.ok);
    EXPECT_EQ(fake.RequestCount(), 1);
    const auto request = fake.LastRequest();
    EXPECT_EQ(std::memcmp(r.response.m_transactionId, request.bytes.data() + 4, 16), 0);
    EXPECT_EQ(r.response.m_mappedAddress.m_address, kLoopback);
    EXPECT_EQ(r.response.m_mappedAddress.m_port, 40123);
    EXPECT_EQ(r.response.m_changedAddress.m_address, 0x7F000063u);
    EXPECT_EQ(r.response.m_changedAddress.m_port, 3479);
    EXPECT_EQ(r.fromAddress, kLoopback);
    EXPECT_EQ(r.fromPort, fake.Port());

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
    struct Case {
        bool changeIp;
        bool changePort;
        uint32_t flags;  // 0: no CHANGE-REQUEST at all
    };
    for (const Case& c :
         {Case{false, false, 0}, Case{true, false, 4}, Case{false, true, 2}, Case{true, true, 6}}) {
        SCOPED_TRACE(c.flags);
        ASSERT_TRUE(RunTest(fake.Port(), kLoopback, c.changeIp, c.changePort).ok);
        const std::vector<uint8_t> b = fake.LastRequest().bytes;
        ASSERT_EQ(b.size(), c.flags == 0 ? 20u : 28u);
        EXPECT_EQ(Read16(b, 0), 0x0001);
        EXPECT_EQ(Read16(b, 2), b.size() - 20);
        if (c.flags != 0) {
            EXPECT_EQ(Read16(b, 20), 0x0003);
            EXPECT_EQ(Read16(b, 22), 4);
            EXPECT_EQ(Read32(b, 24), c.flags);
        }
    }
}

TEST(STUNTransactionFake, LocalPortArgument) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());

    // Absent: a rotating port, not reported.
    ASSERT_TRUE(RunTest(fake.Port()).ok);
    const uint16_t rotating = fake.LastRequest().fromPort;
    EXPECT_GE(rotating, 10000);
    EXPECT_LE(rotating, 60000);

    // Present and 0: a rotating port, written back.
    uint16_t reported = 0;
    ASSERT_TRUE(RunTest(fake.Port(), kLoopback, false, false, &reported).ok);
    EXPECT_EQ(reported, fake.LastRequest().fromPort);

    // Present and not 0: exactly that port, left as it was. Borrow a free one first.
    uint16_t exact = 0;
    platform::SocketHandle probe = foundation::CreateUdpSocket(kLoopback, &exact);
    ASSERT_NE(probe, platform::kInvalidSocket);
    platform::CloseSocket(probe);
    uint16_t asked = exact;
    ASSERT_TRUE(RunTest(fake.Port(), kLoopback, false, false, &asked).ok);
    EXPECT_EQ(asked, exact);
    EXPECT_EQ(fake.LastRequest().fromPort, exact);

    // A taken port fails at once, without sending, and no other port is tried.
    probe = foundation::CreateUdpSocket(kLoopback, &exact);
    ASSERT_NE(probe, platform::kInvalidSocket);
    const int before = fake.RequestCount();
    asked = exact;
    EXPECT_FALSE(RunTest(fake.Port(), kLoopback, false, false, &asked).ok);
    EXPECT_EQ(asked, exact);
    platform::CloseSocket(probe);
    EXPECT_FALSE(fake.WaitForRequests(before + 1, 200));
}

TEST(STUNTransactionFake, NoSocketNoRequest) {
    FakeStunServer fake;
    ASSERT_TRUE(fake.IsRunning());
    const int descriptors = platform::CountOpenDescriptors();
    CSTUNMessage response;
    uint32_t from = 0;
    uint16_t fromPort = 0;
    EXPECT_FALSE(STUN_RunTest(kForeignAddress, nullptr, kLoopback, fake.Port(), false, false,
                              response, from, fromPort));
    EXPECT_FALSE(STUN_RunResponseAddressTest(kForeignAddress, kLoopback, fake.Port(), kLoopback));
    EXPECT_FALSE(fake.WaitForRequests(1, 200));
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
}

// The answer must reach the silent socket from an address and a port that both differ from the
// server's; anything else proves nothing about filtering.
TEST(STUNTransactionFake, ResponseAddressSenderMustDifferInAddressAndPort) {
    struct Case {
        const char* name;
        bool otherAddress;
        bool otherPort;
        bool expected;
    };
    for (const Case& c : {Case{"server's own socket", false, false, false},
                          Case{"same address, other port", false, true, false},
                          Case{"other address, same port", true, false, false},
                          Case{"other address and port", true, true, true}}) {
        SCOPED_TRACE(c.name);
        FakeStunServer fake;
        ASSERT_TRUE(fake.IsRunning());
        if (c.otherAddress || c.otherPort) {
            ASSERT_TRUE(fake.AnswerFrom(c.otherAddress ? kLoopback2 : kLoopback,
                                        c.otherPort ? 0 : fake.Port()));
        }
        const int descriptors = platform::CountOpenDescriptors();
        EXPECT_EQ(STUN_RunResponseAddressTest(kLoopback, kLoopback, fake.Port(), kLoopback),
                  c.expected);
        EXPECT_EQ(fake.RequestCount(), 1);
        EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);

        // CHANGE-REQUEST (change both) first, then RESPONSE-ADDRESS naming our other socket.
        const FakeStunServer::Request request = fake.LastRequest();
        ASSERT_EQ(request.bytes.size(), 40u);
        const uint16_t listenPort = Read16(request.bytes, 34);
        EXPECT_NE(listenPort, request.fromPort);
        std::vector<uint8_t> expected = {0, 1, 0, 20};
        expected.insert(expected.end(), request.bytes.begin() + 4, request.bytes.begin() + 20);
        expected.insert(expected.end(), {0,
                                         3,
                                         0,
                                         4,
                                         0,
                                         0,
                                         0,
                                         6,
                                         0,
                                         2,
                                         0,
                                         8,
                                         0,
                                         1,
                                         static_cast<uint8_t>(listenPort >> 8),
                                         static_cast<uint8_t>(listenPort),
                                         127,
                                         0,
                                         0,
                                         1});
        EXPECT_EQ(request.bytes, expected);
    }
}

// The owner's stop request ends a transaction at once: no further attempts, sockets closed.
TEST(STUNTransactionFake, StopRequestEndsTheTransaction) {
    struct Case {
        const char* name;
        bool responseAddress;
    };
    for (const Case& c : {Case{"binding", false}, Case{"response address", true}}) {
        SCOPED_TRACE(c.name);
        FakeStunServer fake;
        ASSERT_TRUE(fake.IsRunning());
        fake.SetMode(FakeStunServer::Mode::kSilent);
        const int descriptors = platform::CountOpenDescriptors();
        std::atomic<int> result{-1};
        {
            platform::Thread worker;
            ASSERT_TRUE(worker.Start([&] {
                const bool ok =
                    c.responseAddress
                        ? STUN_RunResponseAddressTest(kLoopback, kLoopback, fake.Port(), kLoopback)
                        : RunTest(fake.Port()).ok;
                result = ok ? 1 : 0;
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
