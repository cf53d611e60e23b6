// The STUN result service over loopback. A network-information double decides which local
// addresses exist (127.0.0.1 never counts, so the tests use 127.0.0.5 and up with a made-up
// gateway); the real stund classifies them, and a fake that stays silent holds a pass inside a
// STUN transaction for as long as a test needs.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
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
#include "stun/STUNClassify.h"
#include "stun/STUNResult.h"
#include "tests/support/FakeNetworkInfo.h"
#include "tests/support/FakeStunServer.h"
#include "tests/support/Stund.h"
#include "tests/support/os/process.h"

namespace {

using stun::CSTUNResult;
using stun::STUNResultList;
using testsupport::FakeStunServer;
using Clock = std::chrono::steady_clock;

constexpr platform::UINT kMessage = platform::WM_USER + 123;
constexpr platform::WPARAM kWParam = 42;
constexpr uint32_t kLocal = 0x7F000005;  // 127.0.0.5
constexpr int kPassTimeoutMs = 20000;

// Each address is the only one of an interface with a (made-up) default gateway.
struct LocalAddresses : testsupport::FakeNetworkInfo {
    explicit LocalAddresses(const std::vector<uint32_t>& addresses) {
        for (uint32_t a : addresses) {
            AddInterface(foundation::FormatHostAddress(a), "127.0.0.254");
        }
    }
};

// The owner's window: records what the service posts; the test thread pumps it.
struct Window : platform::MessageWindow {
    struct Posted {
        platform::UINT message;
        platform::WPARAM wParam;
        platform::LPARAM lParam;
    };
    Window() { CreateMessageWindow(); }
    platform::LRESULT WindowProc(platform::UINT message, platform::WPARAM wParam,
                                 platform::LPARAM lParam, bool& handled) override {
        posted.push_back({message, wParam, lParam});
        handled = true;
        return 0;
    }
    // Pumps until count messages arrived; false after timeoutMs.
    bool WaitFor(size_t count, int timeoutMs = kPassTimeoutMs) {
        return platform::RunMessageLoopUntil([&] { return posted.size() >= count; }, timeoutMs);
    }
    std::vector<Posted> posted;
};

// The service under a silent fake. The classification always asks port 3478, so the fake takes
// it on a loopback address of this process's own (derived from the pid, as the stund fixture
// does, but ending in .9).
class STUNResultInATransaction : public ::testing::Test {
  protected:
    void SetUp() override {
        const unsigned pid = static_cast<unsigned>(platform::testing::CurrentProcessId());
        for (unsigned key = pid; key < pid + 8 && !fake_; ++key) {
            const uint32_t address =
                (127u << 24) | ((1 + (key / 256) % 254) << 16) | ((key % 256) << 8) | 9u;
            fake_ = std::make_unique<FakeStunServer>(address, stun::kSTUNPort);
            if (!fake_->IsRunning()) {
                fake_.reset();
            }
        }
        ASSERT_NE(fake_, nullptr);
        fake_->SetMode(FakeStunServer::Mode::kSilent);
        server_ = foundation::FormatHostAddress(fake_->Address());
    }

    LocalAddresses local_{{kLocal}};
    std::unique_ptr<FakeStunServer> fake_;
    std::string server_;
    Window window_;
};

class STUNResultWithStund : public testsupport::StundTest {};

TEST_F(STUNResultWithStund, ReadyOnceARefreshCompletedAPassOfTheFirstTenAddressesAlsoAfterStop) {
    std::vector<uint32_t> addresses;
    for (uint32_t i = 0; i < 12; ++i) {
        addresses.push_back(kLocal + i);
    }
    LocalAddresses local(addresses);
    Window window;
    CSTUNResult service(foundation::FormatHostAddress(stund_.PrimaryAddress()).c_str(),
                        window.Handle(), kMessage, kWParam, local);
    EXPECT_FALSE(service.IsRunning());
    ASSERT_EQ(service.Start(), S_OK);
    EXPECT_TRUE(service.IsRunning());
    EXPECT_FALSE(window.WaitFor(1, 500)) << "starting alone ran a pass";
    EXPECT_FALSE(service.IsSTUNResultReady());

    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_TRUE(window.WaitFor(1));
    EXPECT_EQ(window.posted[0].message, kMessage);
    EXPECT_EQ(window.posted[0].wParam, kWParam);
    EXPECT_EQ(window.posted[0].lParam, 0);
    EXPECT_TRUE(service.IsSTUNResultReady());
    STUNResultList list;
    ASSERT_TRUE(service.GetSTUNResult(&list));
    ASSERT_EQ(list.count, 10);
    // Loopback has no NAT in between: each host is open and seen with its own address.
    for (int i = 0; i < 10; ++i) {
        EXPECT_EQ(list.entries[i].localAddress, addresses[i]) << i;
        EXPECT_EQ(list.entries[i].stunResult, stun::STUN_RESULT_OPEN) << i;
        EXPECT_EQ(list.entries[i].publicAddress, addresses[i]) << i;
    }

    service.Stop();
    EXPECT_FALSE(service.IsRunning());
    EXPECT_TRUE(service.IsSTUNResultReady()) << "Stop keeps the last results";
    ASSERT_EQ(service.Refresh(), S_OK);
    EXPECT_TRUE(service.IsRunning());
    ASSERT_TRUE(window.WaitFor(2)) << "no pass after the restart";
    EXPECT_TRUE(service.IsSTUNResultReady());
}

// With no descriptor left the refresh event cannot be made. The bare system code would pass
// every SUCCEEDED check and leave a discovery waiting for ever.
TEST(STUNResult, StartFailsWhenItsEventCannotBeCreated) {
    CSTUNResult service("127.0.0.1", nullptr, kMessage, kWParam);
    rlimit saved{};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &saved), 0);
    rlimit low = saved;
    low.rlim_cur = static_cast<rlim_t>(platform::CountOpenDescriptors());
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &low), 0);
    std::vector<int> fillers;  // a hole below the limit would still give an event
    for (int fd = 0; (fd = open("/dev/null", O_RDONLY | O_CLOEXEC)) >= 0;) {
        fillers.push_back(fd);
    }
    const HRESULT hr = service.Start();
    for (int fd : fillers) {
        close(fd);
    }
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &saved), 0);
    EXPECT_TRUE(FAILED(hr) && hr == HRESULT_FROM_WIN32(EMFILE)) << std::hex << hr;
}

TEST(STUNResult, APassWithoutAServerOrWithoutAddressesStillStoresAndPosts) {
    // "0.0.0.0" resolves to 0 and a missing list to nothing: both count as unresolved.
    const struct {
        const char* servers;
        std::vector<uint32_t> addresses;
    } cases[] = {
        {"0.0.0.0", {kLocal, kLocal + 1}}, {nullptr, {kLocal, kLocal + 1}}, {"127.0.0.1", {}}};
    for (const auto& c : cases) {
        LocalAddresses local(c.addresses);
        Window window;
        CSTUNResult service(c.servers, window.Handle(), kMessage, kWParam, local);
        ASSERT_EQ(service.Refresh(), S_OK);
        ASSERT_TRUE(window.WaitFor(1));
        STUNResultList list;
        list.count = 5;
        ASSERT_TRUE(service.GetSTUNResult(&list));
        ASSERT_EQ(list.count, static_cast<int>(c.addresses.size()));
        for (int i = 0; i < list.count; ++i) {
            EXPECT_EQ(list.entries[i].localAddress, c.addresses[i]);
            EXPECT_EQ(list.entries[i].stunResult, stun::STUN_RESULT_UNKNOWN);
            EXPECT_EQ(list.entries[i].publicAddress, stun::kNoPublicAddress);
        }
    }
}

TEST_F(STUNResultInATransaction, RefreshesDuringAPassGiveExactlyOneFurtherPass) {
    CSTUNResult service(server_.c_str(), window_.Handle(), kMessage, kWParam, local_);
    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_TRUE(fake_->WaitForRequests(1, 5000));  // the pass now waits for an answer
    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_EQ(service.Refresh(), S_OK);
    EXPECT_FALSE(service.IsSTUNResultReady());
    fake_->SetMode(FakeStunServer::Mode::kAnswer);

    ASSERT_TRUE(window_.WaitFor(2));
    // An answered pass takes milliseconds here: a third one would have posted by now.
    EXPECT_FALSE(window_.WaitFor(3, 1000));
    EXPECT_TRUE(service.IsSTUNResultReady());
}

TEST_F(STUNResultInATransaction, StopEndsThePassAtOnceWithoutResultOrOpenDescriptor) {
    const int descriptors = platform::CountOpenDescriptors();
    CSTUNResult service(server_.c_str(), window_.Handle(), kMessage, kWParam, local_);
    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_TRUE(fake_->WaitForRequests(2, 5000));  // inside the retransmission schedule
    const auto stopping = Clock::now();
    service.Stop();
    EXPECT_LT(Clock::now() - stopping, std::chrono::milliseconds(300));
    EXPECT_FALSE(service.IsRunning());
    // Stop itself, not only the destructor, lets go of the monitor and the pass's sockets.
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
    EXPECT_FALSE(window_.WaitFor(1, 300)) << "the stopped pass posted";
    EXPECT_FALSE(service.IsSTUNResultReady()) << "the stopped pass stored its results";
}

TEST_F(STUNResultInATransaction, GetSTUNResultWaitsOnlyForAPassThatWasAskedFor) {
    CSTUNResult service(server_.c_str(), nullptr, kMessage, kWParam, local_);
    STUNResultList untouched;
    untouched.count = 77;
    EXPECT_FALSE(service.GetSTUNResult(nullptr));
    EXPECT_FALSE(service.GetSTUNResult(&untouched)) << "no Refresh: nothing to wait for";
    EXPECT_TRUE(service.IsRunning());

    ASSERT_EQ(service.Refresh(), S_OK);
    ASSERT_TRUE(fake_->WaitForRequests(1, 5000));  // the pass now waits for an answer
    std::atomic<int> outcome{-1};                  // 1 copied, 0 gave up without copying
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
    EXPECT_LT(Clock::now() - stopping, std::chrono::milliseconds(CSTUNResult::kPollMs + 500));
    EXPECT_EQ(untouched.count, 77);
}

}  // namespace
