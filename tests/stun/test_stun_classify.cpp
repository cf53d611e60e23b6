// The classification sequence against a fake server, for the answers no real server gives, and
// the choice of the first answering server.
#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

#include "stun/STUNClassify.h"
#include "tests/support/DnsLab.h"
#include "tests/support/FakeStunServer.h"
#include "tests/support/LogCapture.h"
#include "tests/support/os/process.h"

namespace {

using testsupport::FakeStunServer;
using testsupport::LogCapture;

constexpr uint32_t kLocal = 0x7F000001;

// A loopback address of this process's own, so that servers on port 3478 do not meet those of
// parallel test processes.
uint32_t OwnLoopback(uint8_t last) {
    const int pid = platform::testing::CurrentProcessId();
    return 0x7F000000u | (static_cast<uint32_t>((pid >> 8) & 0x7F) + 128u) << 16 |
           static_cast<uint32_t>(pid & 0xFF) << 8 | last;
}

stun::STUNResultEntry Classify(const FakeStunServer& server) {
    stun::STUNResultEntry entry;
    entry.localAddress = kLocal;
    entry.stunResult = 0xEE;
    entry.publicAddress = 0;
    stun::STUN_GetResult(server.Address(), server.Port(), entry);
    return entry;
}

// The answers no real server gives; each ends the classification after test 1.
TEST(STUNGetResult, MissingChangedAddressPortTranslationAndSilence) {
    const struct {
        FakeStunServer::Mode mode;
        std::optional<uint16_t> mappedPort;
        uint8_t result;
        int requests;
    } cases[] = {
        {FakeStunServer::Mode::kNoChangedAddress, {}, stun::STUN_RESULT_UNKNOWN, 1},
        {FakeStunServer::Mode::kAnswer, 9, stun::STUN_RESULT_SYMMETRIC_NAT, 1},
        {FakeStunServer::Mode::kSilent, {}, stun::STUN_RESULT_BLOCKED, 6},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(int{c.result});
        FakeStunServer server;
        server.SetMode(c.mode);
        server.SetMappedPort(c.mappedPort);
        LogCapture log;
        const auto entry = Classify(server);
        EXPECT_EQ(entry.stunResult, c.result);
        EXPECT_EQ(entry.publicAddress, stun::kNoPublicAddress);
        EXPECT_EQ(server.RequestCount(), c.requests);
        if (c.result == stun::STUN_RESULT_UNKNOWN) {
            const auto lines = log.LinesOf("STUN_GetResult");
            ASSERT_EQ(lines.size(), 1u);
            EXPECT_EQ(lines[0].level + " " + lines[0].message,
                      "ERROR response on test 1 doesn't have the mandatory attributes");
        }
    }
}

TEST(STUNTestServers, FirstSilentServerIsPassedOverForTheSecond) {
    FakeStunServer silent(OwnLoopback(9), stun::kSTUNPort);
    FakeStunServer answering(OwnLoopback(10), stun::kSTUNPort);
    ASSERT_TRUE(silent.IsRunning());
    ASSERT_TRUE(answering.IsRunning());
    silent.SetMode(FakeStunServer::Mode::kSilent);
    const std::string list = stun::FormatHostOrderAddress(silent.Address()) + "," +
                             stun::FormatHostOrderAddress(answering.Address());
    LogCapture log;
    EXPECT_EQ(stun::STUN_TestServers(kLocal, list.c_str()), 1);
    EXPECT_EQ(silent.RequestCount(), 6);
    EXPECT_EQ(answering.RequestCount(), 1);
    std::vector<std::string> messages;
    for (const auto& line : log.LinesOf("STUN_TestServers")) {
        messages.push_back(line.level + " " + line.message);
    }
    EXPECT_EQ(messages, (std::vector<std::string>{"TRACE Entered...", "ERROR STUN_RunTest() failed",
                                                  "INFO STUN_RunTest() succeeded"}));
}

TEST(STUNTestServers, MissingEmptyAndZeroEntriesFail) {
    LogCapture log;
    EXPECT_EQ(stun::STUN_TestServers(kLocal, nullptr), -1);
    const auto lines = log.LinesOf("STUN_TestServers");
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].message, "Failed Assertion - szCSServers != NULL");
    EXPECT_EQ(stun::STUN_TestServers(kLocal, ""), -1);
    EXPECT_EQ(stun::STUN_TestServers(kLocal, ",,,"), -1);
    // Address 0 counts as a failed server.
    FakeStunServer answering(OwnLoopback(11), stun::kSTUNPort);
    ASSERT_TRUE(answering.IsRunning());
    const std::string list = "0.0.0.0," + stun::FormatHostOrderAddress(answering.Address());
    EXPECT_EQ(stun::STUN_TestServers(kLocal, list.c_str()), 1);
}

}  // namespace

namespace {

TEST(LabDnsTestServers, UnresolvableNamesAreSkippedAndOnlyThoseGiveMinusOne) {
    NQPM_RUN_INSIDE_DNS_LAB("LabDnsTestServers.*")
    const std::string unknown = testsupport::DnsLab::kUnknownName;
    EXPECT_EQ(stun::STUN_TestServers(kLocal, (unknown + "," + unknown).c_str()), -1);
    // stun.lab.test is 127.0.0.1: a server there on 3478 is chosen after the unknown name.
    FakeStunServer answering(kLocal, stun::kSTUNPort);
    ASSERT_TRUE(answering.IsRunning());
    const std::string list = unknown + "," + testsupport::DnsLab::kKnownName;
    EXPECT_EQ(stun::STUN_TestServers(kLocal, list.c_str()), 1);
    EXPECT_EQ(answering.RequestCount(), 1);
}

}  // namespace
