// The UPnP detector with a probe double (one message per detection, on the owner's thread, none
// once destruction has begun), and the real probe against miniupnpd in a LAN of namespaces.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <fstream>
#include <functional>
#include <iostream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/kernel.h"
#include "platform/message.h"
#include "platform/upnp.h"
#include "portmanager/UpnpDetector.h"
#include "tests/support/os/command.h"
#include "tests/support/os/netns.h"
#include "tests/support/os/process.h"

namespace {

using portmanager::UpnpDetector;
using Clock = std::chrono::steady_clock;

constexpr platform::UINT kDetected = platform::WM_USER + 124;
constexpr int kWaitMs = 5000;

int64_t MsSince(Clock::time_point start) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
}

// Stands in for the port manager's hidden window: records each message with what the detector
// says at that moment, as the real handler reads it.
class OwnerWindow : public platform::MessageWindow {
  public:
    struct Delivery {
        platform::UINT message;
        platform::WPARAM wParam;
        platform::LPARAM lParam;
        uint32_t threadId;
        bool found;
    };

    platform::LRESULT WindowProc(platform::UINT message, platform::WPARAM wParam,
                                 platform::LPARAM lParam, bool& handled) override {
        deliveries.push_back({message, wParam, lParam, platform::GetCurrentThreadId(),
                              detector != nullptr && detector->IsUpnpFound()});
        if (onDelivery) {
            onDelivery();
        }
        handled = true;
        return 0;
    }
    bool WaitFor(size_t count) {
        return platform::RunMessageLoopUntil([&] { return deliveries.size() >= count; }, kWaitMs);
    }

    UpnpDetector* detector = nullptr;
    std::vector<Delivery> deliveries;
    std::function<void()> onDelivery;
};

// Joins the detection thread, then delivers whatever it could still have posted. Returns how
// long the destructor took.
int64_t DestroyAndDrain(OwnerWindow& window, std::unique_ptr<UpnpDetector>& detector) {
    window.detector = nullptr;
    const auto start = Clock::now();
    detector.reset();
    const int64_t elapsed = MsSince(start);
    platform::PumpPendingMessages();
    return elapsed;
}

class FakeProbe : public platform::UpnpGatewayProbe {
  public:
    bool GatewayPresent() override {
        ++calls;
        entered.Set();
        if (holdUntilReleased && release.Wait(-1) != platform::WaitResult::Signaled) {
            return false;  // asked to stop, as the real probe answers then
        }
        // Like miniupnpc's search wait, which no stop request shortens.
        std::this_thread::sleep_for(std::chrono::milliseconds(uninterruptibleMs));
        return answer.load();
    }

    std::atomic<bool> answer{false};
    std::atomic<int> calls{0};
    bool holdUntilReleased = false;  // set before Start
    int uninterruptibleMs = 0;       // set before Start
    platform::Event entered;
    platform::Event release{true};
};

class UpnpDetectorTest : public ::testing::Test {
  protected:
    void SetUp() override { ASSERT_TRUE(window_.CreateMessageWindow()); }

    void NewDetector() {
        detector_ = std::make_unique<UpnpDetector>(probe_);
        window_.detector = detector_.get();
    }
    // Starts a detection and returns once the probe has been entered.
    void StartAndEnterProbe() {
        NewDetector();
        ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 0), S_OK);
        ASSERT_EQ(probe_.entered.Wait(kWaitMs), platform::WaitResult::Signaled);
    }

    FakeProbe probe_;
    OwnerWindow window_;
    std::unique_ptr<UpnpDetector> detector_;
};

TEST_F(UpnpDetectorTest, PostsTheProbesAnswerOnceToTheOwnerThreadAndRejectsANullWindow) {
    for (const bool answer : {false, true}) {
        SCOPED_TRACE(answer ? "gateway" : "no gateway");
        NewDetector();
        window_.deliveries.clear();
        probe_.answer = answer;
        EXPECT_FALSE(detector_->IsUpnpFound());
        EXPECT_EQ(detector_->Start(nullptr, kDetected, 0), E_INVALIDARG);
        // Had the rejected call started a detection, this one would be swallowed as "running".
        ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 0x5A), S_OK);
        ASSERT_TRUE(window_.WaitFor(1));
        DestroyAndDrain(window_, detector_);

        EXPECT_EQ(probe_.calls.load(), answer ? 2 : 1);
        ASSERT_EQ(window_.deliveries.size(), 1u);
        const auto& d = window_.deliveries[0];
        EXPECT_EQ(d.message, kDetected);
        EXPECT_EQ(d.wParam, 0x5Au);
        EXPECT_EQ(d.lParam, 0);
        EXPECT_EQ(d.threadId, platform::GetCurrentThreadId());
        EXPECT_EQ(d.found, answer);
    }
}

TEST_F(UpnpDetectorTest, StartWhileRunningAddsNothingAndStartAfterTheMessageRunsAgain) {
    // Held in the probe: a second Start adds no detection and no message.
    probe_.holdUntilReleased = true;
    ASSERT_NO_FATAL_FAILURE(StartAndEnterProbe());
    EXPECT_EQ(detector_->Start(window_.Handle(), kDetected + 1, 9), S_OK);
    // The port manager may start again from the very handler of the message, while the thread
    // that posted it is still returning; and again later from outside.
    window_.onDelivery = [&] {
        if (window_.deliveries.size() == 1) {
            probe_.answer = true;
            EXPECT_EQ(detector_->Start(window_.Handle(), kDetected, 1), S_OK);
        }
    };
    probe_.release.Set();
    ASSERT_TRUE(window_.WaitFor(2));
    probe_.answer = false;
    ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 2), S_OK);
    ASSERT_TRUE(window_.WaitFor(3));
    DestroyAndDrain(window_, detector_);

    EXPECT_EQ(probe_.calls.load(), 3);
    ASSERT_EQ(window_.deliveries.size(), 3u);
    for (size_t i = 0; i < 3; ++i) {
        EXPECT_EQ(window_.deliveries[i].message, kDetected) << i;
        EXPECT_EQ(window_.deliveries[i].wParam, i) << i;
        EXPECT_EQ(window_.deliveries[i].found, i == 1) << i;
    }
}

TEST_F(UpnpDetectorTest, DestructionStopsAWaitingProbeAtOnceOutwaitsADeafOneAndPostsNothing) {
    // Should the destructor not ask the probe to stop, this ends the wait so the test fails
    // on time instead of hanging.
    platform::Event done;
    std::thread rescue([&] {
        if (done.Wait(3000) == platform::WaitResult::Timeout) {
            probe_.release.Set();
        }
    });
    probe_.holdUntilReleased = true;
    StartAndEnterProbe();
    EXPECT_LT(DestroyAndDrain(window_, detector_), 1000);
    done.Set();
    rescue.join();

    // This probe ends on its own after the destructor began; its outcome must not be posted.
    probe_.holdUntilReleased = false;
    probe_.uninterruptibleMs = 300;
    probe_.answer = true;
    ASSERT_NO_FATAL_FAILURE(StartAndEnterProbe());
    EXPECT_LT(DestroyAndDrain(window_, detector_), 300 + 1000);
    EXPECT_TRUE(window_.deliveries.empty());
}

// ---- The real probe in a lab ----------------------------------------------------------------

// A LAN of two namespaces, the test's thread (and the threads it starts) inside the client
// (eth0 10.77.0.2, default route via the router). The router has lan 10.77.0.1 and wan
// 198.51.100.254, a documentation address, so miniupnpc calls the gateway's external address
// reserved; StartGateway runs miniupnpd on it.
class UpnpLan {
  public:
    ~UpnpLan() {
        miniupnpd_.Stop();
        for (const char* ext : {".conf", ".pid", ".leases", ".log"}) {
            std::remove((base_ + ext).c_str());
        }
    }

    bool Up() {
        return router_.IsValid() && client_.IsValid() &&
               router_.Ip("link add lan type veth peer name eth0 netns " + client_.Name()) &&
               router_.Ip("addr add 10.77.0.1/24 dev lan") && router_.Ip("link set lan up") &&
               router_.Ip("link add wan type veth peer name wanpeer") &&
               router_.Ip("addr add 198.51.100.254/24 dev wan") &&
               router_.Ip("link set wanpeer up") && router_.Ip("link set wan up") &&
               client_.Ip("addr add 10.77.0.2/24 dev eth0") && client_.Ip("link set eth0 up") &&
               client_.Ip("route add default via 10.77.0.1") && client_.Enter();
    }

    bool StartGateway() {
        char uuid[40];
        std::snprintf(uuid, sizeof uuid, "4e51706d-0000-4000-8000-%012x",
                      static_cast<unsigned>(platform::testing::CurrentProcessId()));
        std::ofstream out(base_ + ".conf");
        out << "ext_ifname=wan\nlistening_ip=lan\nhttp_port=0\nenable_upnp=yes\n"
               "enable_natpmp=no\nsecure_mode=yes\nipv6_disable=yes\nuuid="
            << uuid << "\nlease_file=" << base_ << ".leases\n"
            << "upnp_table_name=nqpm_upnp\nupnp_nat_table_name=nqpm_upnp\n"
               "allow 1024-65535 10.77.0.0/24 1024-65535\ndeny 0-65535 0.0.0.0/0 0-65535\n";
        out.close();
        if (!out || !miniupnpd_.Start({"ip", "netns", "exec", router_.Name(), "miniupnpd", "-d",
                                       "-f", base_ + ".conf", "-P", base_ + ".pid"},
                                      base_ + ".log")) {
            return false;
        }
        // miniupnpd signals no readiness; it joins the SSDP group after its HTTP socket
        // listens, and M-SEARCHes queue from then on.
        const auto start = Clock::now();
        while (MsSince(start) < kWaitMs && miniupnpd_.IsRunning()) {
            std::string groups;
            if (platform::testing::RunCommand(
                    {"ip", "-n", router_.Name(), "maddr", "show", "dev", "lan"}, &groups) == 0 &&
                groups.find("239.255.255.250") != std::string::npos) {
                return true;
            }
            platform::Sleep(50);
        }
        std::cerr << "miniupnpd did not come up:\n" << std::ifstream(base_ + ".log").rdbuf();
        return false;
    }

  private:
    // miniupnpd ends (in ~UpnpLan) before the namespaces go.
    platform::testing::ScopedNetns router_{"nqupnp-gw"};
    platform::testing::ScopedNetns client_{"nqupnp-cl"};
    const std::string base_ = "/tmp/nqpm-upnp-" + router_.Name();
    platform::testing::Process miniupnpd_;
};

// What the host's users wait for at most: the search plus a LAN round trip or two.
constexpr int kPromptMs = 2 * platform::kUpnpSearchMs;

TEST(LabUpnp, ProbeAndDetectorSeeNoGatewayThenMiniupnpdAlthoughItsExternalAddressIsReserved) {
    if (!platform::testing::IsRoot() || platform::testing::FindExecutable("miniupnpd").empty() ||
        platform::testing::FindExecutable("ip").empty()) {
        GTEST_SKIP() << "needs root, ip and miniupnpd";
    }
    UpnpLan lan;
    ASSERT_TRUE(lan.Up());
    OwnerWindow window;
    ASSERT_TRUE(window.CreateMessageWindow());
    for (const bool gateway : {false, true}) {
        SCOPED_TRACE(gateway ? "miniupnpd" : "no gateway");
        ASSERT_TRUE(!gateway || lan.StartGateway());
        const auto start = Clock::now();
        EXPECT_EQ(platform::SystemUpnpGatewayProbe().GatewayPresent(), gateway);
        const int64_t probeMs = MsSince(start);
        EXPECT_LT(probeMs, kPromptMs);
        std::cout << "[ measured ] probe, gateway " << gateway << ": " << probeMs << " ms\n";

        auto detector = std::make_unique<UpnpDetector>();
        window.detector = detector.get();
        window.deliveries.clear();
        ASSERT_EQ(detector->Start(window.Handle(), kDetected, 0), S_OK);
        ASSERT_TRUE(window.WaitFor(1));
        EXPECT_EQ(window.deliveries[0].message, kDetected);
        EXPECT_EQ(window.deliveries[0].found, gateway);
        if (!gateway) {  // only a missing gateway makes the search last
            ASSERT_EQ(detector->Start(window.Handle(), kDetected, 0), S_OK);
            platform::Sleep(platform::kUpnpSearchMs / 5);  // into the search
            const int64_t elapsed = DestroyAndDrain(window, detector);
            EXPECT_LT(elapsed, platform::kUpnpSearchMs + 500);
            EXPECT_EQ(window.deliveries.size(), 1u);
            std::cout << "[ measured ] destroyed mid-search after: " << elapsed << " ms\n";
        }
    }
}

}  // namespace
