// The STUN result service over loopback. A network-information double decides which local
// addresses exist (127.0.0.1 never counts, so the tests use 127.0.0.5 and up with a made-up
// gateway); the real stund classifies them, and a fake that stays silent holds a pass inside a
// STUN transaction for as long as a test needs.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "foundation/NetUtils.h"
#include "platform/kernel.h"
#include "platform/message.h"
#include "platform/net.h"
#include "platform/testing/process.h"
#include "stun/STUNClassify.h"
#include "stun/STUNResult.h"
#include "tests/support/FakeNetworkInfo.h"
#include "tests/support/FakeStunServer.h"
#include "tests/support/Stund.h"

namespace {

using stun::CSTUNResult;
using stun::STUNResultList;
using testsupport::FakeStunServer;
using Clock = std::chrono::steady_clock;

constexpr platform::UINT kMessage = platform::WM_USER + 123;
constexpr platform::WPARAM kWParam = 42;
constexpr uint32_t kLocal = 0x7F000005;  // 127.0.0.5
constexpr int kPassTimeoutMs = 20000;

int64_t MsSince(Clock::time_point start) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
}

// Each address is the only one of an interface with a (made-up) default gateway. Set up before
// the service starts and only read afterwards.
class LocalAddresses {
  public:
    explicit LocalAddresses(const std::vector<uint32_t>& addresses) {
        for (uint32_t a : addresses) {
            info_.AddInterface(foundation::FormatHostAddress(a), "127.0.0.254");
        }
    }

  private:
    testsupport::FakeNetworkInfo info_;
};

// The owner's window: records what the service posts; the test thread pumps it.
class Window : public platform::MessageWindow {
  public:
    struct Posted {
        platform::UINT message;
        platform::WPARAM wParam;
        platform::LPARAM lParam;
    };

    Window() { CreateMessageWindow(); }
    ~Window() override { DestroyMessageWindow(); }

    platform::LRESULT WindowProc(platform::UINT message, platform::WPARAM wParam,
                                 platform::LPARAM lParam, bool& handled) override {
        posted.push_back({message, wParam, lParam});
        handled = true;
        return 0;
    }
    // Pumps until count messages arrived; false after timeoutMs.
    bool WaitFor(size_t count, int timeoutMs) {
        return platform::RunMessageLoopUntil([&] { return posted.size() >= count; }, timeoutMs);
    }

    std::vector<Posted> posted;
};

// The classification always asks port 3478, so the fake takes it on a loopback address of this
// process's own (derived from the pid, as the stund fixture does, but ending in .9).
std::unique_ptr<FakeStunServer> StartFakeOn3478() {
    const unsigned pid = static_cast<unsigned>(platform::testing::CurrentProcessId());
    for (unsigned candidate = 0; candidate < 8; ++candidate) {
        const unsigned key = pid + candidate;
        const uint32_t address =
            (127u << 24) | ((1 + (key / 256) % 254) << 16) | ((key % 256) << 8) | 9u;
        auto server = std::make_unique<FakeStunServer>(address, stun::kSTUNPort);
        if (server->IsRunning()) {
            return server;
        }
    }
    return nullptr;
}

std::string Text(uint32_t address) {
    return foundation::FormatHostAddress(address);
}

class STUNResultWithStund : public testsupport::StundTest {};

TEST_F(STUNResultWithStund, ReadyOnlyOnceARefreshHasCompletedAPassAlsoAfterARestart) {
    LocalAddresses local({kLocal});
    Window window;
    CSTUNResult service(Text(stund_.PrimaryAddress()).c_str(), window.Handle(), kMessage, kWParam);
    EXPECT_FALSE(service.IsRunning());
    ASSERT_EQ(service.Start(), S_OK);
    EXPECT_TRUE(service.IsRunning());
    EXPECT_FALSE(window.WaitFor(1, 500)) << "starting alone ran a pass";
    EXPECT_FALSE(service.IsSTUNResultReady());

    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_TRUE(window.WaitFor(1, kPassTimeoutMs));
    EXPECT_EQ(window.posted[0].message, kMessage);
    EXPECT_EQ(window.posted[0].wParam, kWParam);
    EXPECT_EQ(window.posted[0].lParam, 0);
    EXPECT_TRUE(service.IsSTUNResultReady());
    STUNResultList list;
    ASSERT_TRUE(service.GetSTUNResult(&list));
    ASSERT_EQ(list.count, 1);
    // Loopback has no NAT in between: the host is open and seen with its own address.
    EXPECT_EQ(list.entries[0].localAddress, kLocal);
    EXPECT_EQ(list.entries[0].stunResult, stun::STUN_RESULT_OPEN);
    EXPECT_EQ(list.entries[0].publicAddress, kLocal);

    service.Stop();
    EXPECT_FALSE(service.IsRunning());
    EXPECT_TRUE(service.IsSTUNResultReady()) << "Stop keeps the last results";
    ASSERT_EQ(service.Refresh(), S_OK);
    EXPECT_TRUE(service.IsRunning());
    ASSERT_TRUE(window.WaitFor(2, kPassTimeoutMs)) << "no pass after the restart";
    EXPECT_TRUE(service.IsSTUNResultReady());
}

TEST_F(STUNResultWithStund, APassClassifiesOnlyTheFirstTenAddressesInTheirOrder) {
    std::vector<uint32_t> addresses;
    for (uint32_t i = 0; i < 12; ++i) {
        addresses.push_back(kLocal + i);
    }
    LocalAddresses local(addresses);
    Window window;
    CSTUNResult service(Text(stund_.PrimaryAddress()).c_str(), window.Handle(), kMessage, kWParam);
    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_TRUE(window.WaitFor(1, kPassTimeoutMs));
    STUNResultList list;
    ASSERT_TRUE(service.GetSTUNResult(&list));
    ASSERT_EQ(list.count, 10);
    for (int i = 0; i < 10; ++i) {
        EXPECT_EQ(list.entries[i].localAddress, addresses[i]) << i;
        EXPECT_EQ(list.entries[i].stunResult, stun::STUN_RESULT_OPEN) << i;
        EXPECT_EQ(list.entries[i].publicAddress, addresses[i]) << i;
    }
}

TEST(STUNResult, APassWithoutAServerOrWithoutAddressesStillStoresAndPosts) {
    // "0.0.0.0" resolves to 0 and a missing list to nothing: both count as unresolved.
    for (const char* servers : {"0.0.0.0", static_cast<const char*>(nullptr)}) {
        LocalAddresses local({kLocal, kLocal + 1});
        Window window;
        CSTUNResult service(servers, window.Handle(), kMessage, kWParam);
        ASSERT_EQ(service.Refresh(), S_OK);
        ASSERT_TRUE(window.WaitFor(1, kPassTimeoutMs));
        STUNResultList list;
        ASSERT_TRUE(service.GetSTUNResult(&list));
        ASSERT_EQ(list.count, 2);
        for (int i = 0; i < 2; ++i) {
            EXPECT_EQ(list.entries[i].localAddress, kLocal + static_cast<uint32_t>(i));
            EXPECT_EQ(list.entries[i].stunResult, stun::STUN_RESULT_UNKNOWN);
            EXPECT_EQ(list.entries[i].publicAddress, stun::kNoPublicAddress);
        }
    }
    LocalAddresses none({});
    Window window;
    CSTUNResult service("127.0.0.1", window.Handle(), kMessage, kWParam);
    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_TRUE(window.WaitFor(1, kPassTimeoutMs));
    STUNResultList list;
    list.count = 5;
    ASSERT_TRUE(service.GetSTUNResult(&list));
    EXPECT_EQ(list.count, 0);
}

TEST(STUNResult, RefreshesDuringAPassGiveExactlyOneFurtherPass) {
    LocalAddresses local({kLocal});
    auto fake = StartFakeOn3478();
    ASSERT_NE(fake, nullptr);
    fake->SetMode(FakeStunServer::Mode::kSilent);
    Window window;
    CSTUNResult service(Text(fake->Address()).c_str(), window.Handle(), kMessage, kWParam);
    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_TRUE(fake->WaitForRequests(1, 5000));  // the pass now waits for an answer
    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_EQ(service.Refresh(), S_OK);
    EXPECT_FALSE(service.IsSTUNResultReady());
    fake->SetMode(FakeStunServer::Mode::kAnswer);

    ASSERT_TRUE(window.WaitFor(2, kPassTimeoutMs));
    // An answered pass takes milliseconds here: a third one would have posted by now.
    EXPECT_FALSE(window.WaitFor(3, 1000));
    EXPECT_TRUE(service.IsSTUNResultReady());
}

TEST(STUNResult, StopInsideATransactionEndsThePassAtOnceWithoutResultOrLeak) {
    LocalAddresses local({kLocal});
    auto fake = StartFakeOn3478();
    ASSERT_NE(fake, nullptr);
    fake->SetMode(FakeStunServer::Mode::kSilent);
    Window window;
    const int descriptors = platform::CountOpenDescriptors();
    {
        CSTUNResult service(Text(fake->Address()).c_str(), window.Handle(), kMessage, kWParam);
        ASSERT_EQ(service.Refresh(), S_OK);
        ASSERT_TRUE(fake->WaitForRequests(2, 5000));  // inside the retransmission schedule
        const auto stopping = Clock::now();
        service.Stop();
        EXPECT_LT(MsSince(stopping), 300);
        EXPECT_FALSE(service.IsRunning());
        EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
        EXPECT_FALSE(window.WaitFor(1, 300)) << "the stopped pass posted";
        EXPECT_FALSE(service.IsSTUNResultReady()) << "the stopped pass stored its results";
    }
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
}

TEST(STUNResult, GetSTUNResultWaitsOnlyForAPassThatWasAskedFor) {
    LocalAddresses local({kLocal});
    auto fake = StartFakeOn3478();
    ASSERT_NE(fake, nullptr);
    fake->SetMode(FakeStunServer::Mode::kSilent);
    CSTUNResult service(Text(fake->Address()).c_str(), nullptr, kMessage, kWParam);
    STUNResultList untouched;
    untouched.count = 77;
    EXPECT_FALSE(service.GetSTUNResult(nullptr));
    EXPECT_FALSE(service.GetSTUNResult(&untouched)) << "no Refresh: nothing to wait for";
    EXPECT_TRUE(service.IsRunning());

    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_TRUE(fake->WaitForRequests(1, 5000));  // the pass now waits for an answer
    std::atomic<int> outcome{-1};                 // 1 copied, 0 gave up without copying
    std::thread reader([&] {
        STUNResultList list = untouched;
        const bool copied = service.GetSTUNResult(&list);
        outcome = copied ? 1 : (list.count == 77 ? 0 : 2);
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_EQ(outcome.load(), -1) << "returned while the pass ran";
    const auto stopping = Clock::now();
    service.Stop();
    reader.join();
    EXPECT_EQ(outcome.load(), 0);
    EXPECT_LT(MsSince(stopping), CSTUNResult::kPollMs + 500);
    EXPECT_EQ(untouched.count, 77);
}

}  // namespace
