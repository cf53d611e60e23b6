// The UPnP detector with a probe double (one message per detection, on the owner's thread, none
// once destruction has begun), and the real probe against miniupnpd in a LAN of namespaces.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <fstream>
#include <functional>
#include <iomanip>
#include <iostream>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/kernel.h"
#include "platform/message.h"
#include "platform/testing/command.h"
#include "platform/testing/netns.h"
#include "platform/testing/process.h"
#include "platform/upnp.h"
#include "portmanager/UpnpDetector.h"

namespace {

using platform::LPARAM;
using platform::LRESULT;
using platform::UINT;
using platform::WPARAM;
using portmanager::UpnpDetector;

constexpr UINT kDetected = platform::WM_USER + 124;
constexpr int kWaitMs = 5000;

int64_t MillisecondsSince(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() -
                                                                 start)
        .count();
}

// Stands in for the port manager's hidden window: records what arrives and what the detector
// says at that moment, as the real handler reads it.
class OwnerWindow : public platform::MessageWindow {
  public:
    struct Delivery {
        UINT message;
        WPARAM wParam;
        LPARAM lParam;
        uint32_t threadId;
        bool found;
    };

    LRESULT WindowProc(UINT message, WPARAM wParam, LPARAM lParam, bool& handled) override {
        deliveries.push_back({message, wParam, lParam, platform::GetCurrentThreadId(),
                              detector != nullptr && detector->IsUpnpFound()});
        if (onDelivery) {
            onDelivery();
        }
        handled = true;
        return 0;
    }

    bool WaitForDeliveries(size_t count) {
        return platform::RunMessageLoopUntil([&] { return deliveries.size() >= count; }, kWaitMs);
    }

    UpnpDetector* detector = nullptr;
    std::vector<Delivery> deliveries;
    std::function<void()> onDelivery;
};

class FakeProbe : public platform::UpnpGatewayProbe {
  public:
    bool GatewayPresent() override {
        ++calls;
        entered.Set();
        if (holdUntilReleased && release.Wait(-1) != platform::WaitResult::Signaled) {
            return false;  // asked to stop, as the real probe answers then
        }
        if (uninterruptibleMs > 0) {
            // Like miniupnpc's search wait, which no stop request shortens.
            std::this_thread::sleep_for(std::chrono::milliseconds(uninterruptibleMs));
        }
        return answer.load();
    }

    std::atomic<bool> answer{false};
    std::atomic<int> calls{0};
    bool holdUntilReleased = false;  // set before Start
    int uninterruptibleMs = 0;       // set before Start
    platform::Event entered;
    platform::Event release{true};
};

class InstalledProbe {
  public:
    explicit InstalledProbe(platform::UpnpGatewayProbe& probe) {
        platform::InstallUpnpGatewayProbe(&probe);
    }
    ~InstalledProbe() { platform::InstallUpnpGatewayProbe(nullptr); }
    InstalledProbe(const InstalledProbe&) = delete;
    InstalledProbe& operator=(const InstalledProbe&) = delete;
};

class UpnpDetectorTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_TRUE(window_.CreateMessageWindow());
        window_.detector = detector_.get();
    }

    // Joins the detection thread, then delivers whatever it could still have posted.
    void DestroyDetectorAndDrain() {
        window_.detector = nullptr;
        detector_.reset();
        platform::PumpPendingMessages();
    }

    FakeProbe probe_;
    InstalledProbe installed_{probe_};
    OwnerWindow window_;
    std::unique_ptr<UpnpDetector> detector_ = std::make_unique<UpnpDetector>();
};

TEST_F(UpnpDetectorTest, PostsTheProbesAnswerOnceToTheOwnerThread) {
    for (const bool answer : {false, true}) {
        SCOPED_TRACE(answer ? "gateway" : "no gateway");
        detector_ = std::make_unique<UpnpDetector>();
        window_.detector = detector_.get();
        window_.deliveries.clear();
        probe_.answer = answer;
        EXPECT_FALSE(detector_->IsUpnpFound());

        ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 0x5A), S_OK);
        ASSERT_TRUE(window_.WaitForDeliveries(1));
        DestroyDetectorAndDrain();

        ASSERT_EQ(window_.deliveries.size(), 1u);
        const auto& d = window_.deliveries[0];
        EXPECT_EQ(d.message, kDetected);
        EXPECT_EQ(d.wParam, 0x5Au);
        EXPECT_EQ(d.lParam, 0);
        EXPECT_EQ(d.threadId, platform::GetCurrentThreadId());
        EXPECT_EQ(d.found, answer);
    }
}

TEST_F(UpnpDetectorTest, NullWindowIsRejectedAndChangesNothing) {
    EXPECT_EQ(detector_->Start(nullptr, kDetected, 0), E_INVALIDARG);
    // Had the rejected call started a detection, this one would be swallowed as "running".
    ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 0), S_OK);
    ASSERT_TRUE(window_.WaitForDeliveries(1));
    DestroyDetectorAndDrain();
    EXPECT_EQ(probe_.calls.load(), 1);
    EXPECT_EQ(window_.deliveries.size(), 1u);
}

TEST_F(UpnpDetectorTest, StartWhileADetectionRunsAddsNoDetectionAndNoMessage) {
    probe_.holdUntilReleased = true;
    ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 1), S_OK);
    ASSERT_EQ(probe_.entered.Wait(kWaitMs), platform::WaitResult::Signaled);
    EXPECT_EQ(detector_->Start(window_.Handle(), kDetected + 1, 2), S_OK);
    probe_.release.Set();
    ASSERT_TRUE(window_.WaitForDeliveries(1));
    DestroyDetectorAndDrain();

    EXPECT_EQ(probe_.calls.load(), 1);
    ASSERT_EQ(window_.deliveries.size(), 1u);
    EXPECT_EQ(window_.deliveries[0].message, kDetected);
    EXPECT_EQ(window_.deliveries[0].wParam, 1u);
}

TEST_F(UpnpDetectorTest, StartAfterTheMessageRunsANewDetectionWithItsOwnOutcome) {
    // The port manager may start again from the very handler of the message, while the thread
    // that posted it is still returning; and again later from outside.
    window_.onDelivery = [&] {
        if (window_.deliveries.size() == 1) {
            probe_.answer = true;
            EXPECT_EQ(detector_->Start(window_.Handle(), kDetected, 2), S_OK);
        }
    };
    ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 1), S_OK);
    ASSERT_TRUE(window_.WaitForDeliveries(2));
    probe_.answer = false;
    ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 3), S_OK);
    ASSERT_TRUE(window_.WaitForDeliveries(3));
    DestroyDetectorAndDrain();

    EXPECT_EQ(probe_.calls.load(), 3);
    ASSERT_EQ(window_.deliveries.size(), 3u);
    const bool found[] = {false, true, false};
    for (size_t i = 0; i < 3; ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(window_.deliveries[i].wParam, i + 1);
        EXPECT_EQ(window_.deliveries[i].found, found[i]);
    }
}

TEST_F(UpnpDetectorTest, DestructionStopsAWaitingProbePromptlyAndPostsNothing) {
    probe_.holdUntilReleased = true;
    // Should the destructor not ask the probe to stop, this ends the wait so the test fails
    // on time instead of hanging.
    platform::Event done;
    std::thread rescue([&] {
        if (done.Wait(3000) == platform::WaitResult::Timeout) {
            probe_.release.Set();
        }
    });
    ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 0), S_OK);
    ASSERT_EQ(probe_.entered.Wait(kWaitMs), platform::WaitResult::Signaled);
    const auto start = std::chrono::steady_clock::now();
    DestroyDetectorAndDrain();
    const auto elapsed = MillisecondsSince(start);
    done.Set();
    rescue.join();

    EXPECT_LT(elapsed, 1000);
    EXPECT_TRUE(window_.deliveries.empty());
}

TEST_F(UpnpDetectorTest, DestructionWaitsForAProbeDeafToStopButPostsNothing) {
    probe_.uninterruptibleMs = 300;
    probe_.answer = true;
    ASSERT_EQ(detector_->Start(window_.Handle(), kDetected, 0), S_OK);
    ASSERT_EQ(probe_.entered.Wait(kWaitMs), platform::WaitResult::Signaled);
    const auto start = std::chrono::steady_clock::now();
    DestroyDetectorAndDrain();
    const auto elapsed = MillisecondsSince(start);

    // The probe ends on its own after the destructor began; its outcome must not be posted.
    EXPECT_LT(elapsed, 300 + 1000);
    EXPECT_TRUE(window_.deliveries.empty());
}

// ---- The real probe in a lab ----------------------------------------------------------------

using platform::testing::ScopedNetns;

// Removes the lab's files in /tmp however the test ends.
class TempFiles {
  public:
    ~TempFiles() {
        for (const auto& path : paths_) {
            std::remove(path.c_str());
        }
    }
    const std::string& Add(const std::string& path) { return paths_.emplace_back(path); }

  private:
    std::vector<std::string> paths_;
};

// A LAN of two namespaces: the client (eth0 10.77.0.2, default route via the router) and its
// router (lan 10.77.0.1; wan 198.51.100.254, a documentation address, so miniupnpc calls the
// gateway's external address reserved). With a gateway, the router runs miniupnpd.
class UpnpLan {
  public:
    static bool CanRun() {
        return platform::testing::IsRoot() &&
               !platform::testing::FindExecutable("miniupnpd").empty() &&
               !platform::testing::FindExecutable("ip").empty();
    }

    ~UpnpLan() { miniupnpd_.Stop(); }

    bool Up(bool withGateway) {
        if (!router_.IsValid() || !client_.IsValid()) {
            return false;
        }
        const bool wired =
            router_.Ip("link add lan type veth peer name eth0 netns " + client_.Name()) &&
            router_.Ip("addr add 10.77.0.1/24 dev lan") && router_.Ip("link set lan up") &&
            router_.Ip("link add wan type veth peer name wanpeer") &&
            router_.Ip("addr add 198.51.100.254/24 dev wan") && router_.Ip("link set wanpeer up") &&
            router_.Ip("link set wan up") && client_.Ip("addr add 10.77.0.2/24 dev eth0") &&
            client_.Ip("link set eth0 up") && client_.Ip("route add default via 10.77.0.1");
        return wired && (!withGateway || StartGateway());
    }

    ScopedNetns& Client() { return client_; }

  private:
    bool StartGateway() {
        const std::string base = "/tmp/nqpm-upnp-" + router_.Name();
        const std::string conf = files_.Add(base + ".conf");
        const std::string pid = files_.Add(base + ".pid");
        const std::string leases = files_.Add(base + ".leases");
        const std::string log = files_.Add(base + ".log");
        std::ostringstream uuid;
        uuid << "4e51706d-0000-4000-8000-" << std::hex << std::setfill('0') << std::setw(12)
             << platform::testing::CurrentProcessId();
        std::ofstream out(conf);
        out << "ext_ifname=wan\n"
               "listening_ip=lan\n"
               "http_port=0\n"
               "enable_upnp=yes\n"
               "enable_natpmp=no\n"
               "secure_mode=yes\n"
               "ipv6_disable=yes\n"
               "uuid="
            << uuid.str()
            << "\n"
               "lease_file="
            << leases
            << "\n"
               "upnp_table_name=nqpm_upnp\n"
               "upnp_nat_table_name=nqpm_upnp\n"
               "allow 1024-65535 10.77.0.0/24 1024-65535\n"
               "deny 0-65535 0.0.0.0/0 0-65535\n";
        out.close();
        if (!out || !miniupnpd_.Start({"ip", "netns", "exec", router_.Name(), "miniupnpd", "-d",
                                       "-f", conf, "-P", pid},
                                      log)) {
            return false;
        }
        // miniupnpd signals no readiness; it joins the SSDP group after its HTTP socket
        // listens, and M-SEARCHes queue from then on.
        const auto start = std::chrono::steady_clock::now();
        while (MillisecondsSince(start) < kWaitMs) {
            std::string groups;
            if (platform::testing::RunCommand(
                    {"ip", "-n", router_.Name(), "maddr", "show", "dev", "lan"}, &groups) == 0 &&
                groups.find("239.255.255.250") != std::string::npos) {
                return true;
            }
            if (!miniupnpd_.IsRunning()) {
                break;
            }
            platform::Sleep(50);
        }
        std::ifstream complaint(log);
        std::cerr << "miniupnpd did not come up:\n" << complaint.rdbuf();
        return false;
    }

    // Destroyed in reverse: miniupnpd ends before its files and namespaces go.
    ScopedNetns router_{"nqupnp-gw"};
    ScopedNetns client_{"nqupnp-cl"};
    TempFiles files_;
    platform::testing::Process miniupnpd_;
};

// The calling thread's stay in a namespace; threads it starts meanwhile live there too.
class Inside {
  public:
    explicit Inside(ScopedNetns& ns) : ns_(ns), entered_(ns.Enter()) {}
    ~Inside() { ns_.Leave(); }
    Inside(const Inside&) = delete;
    Inside& operator=(const Inside&) = delete;
    bool Entered() const { return entered_; }

  private:
    ScopedNetns& ns_;
    bool entered_;
};

// What the host's users wait for at most: the search plus a LAN round trip or two.
constexpr int kPromptMs = 2 * platform::kUpnpSearchMs;

bool TimedProbe(int64_t& elapsedMs) {
    const auto start = std::chrono::steady_clock::now();
    const bool found = platform::SystemUpnpGatewayProbe().GatewayPresent();
    elapsedMs = MillisecondsSince(start);
    return found;
}

TEST(LabUpnpGateway, ProbeFindsMiniupnpdAlthoughItsExternalAddressIsReserved) {
    if (!UpnpLan::CanRun()) {
        GTEST_SKIP() << "needs root, ip and miniupnpd";
    }
    UpnpLan lan;
    ASSERT_TRUE(lan.Up(true));
    Inside inside(lan.Client());
    ASSERT_TRUE(inside.Entered());
    int64_t elapsed = 0;
    EXPECT_TRUE(TimedProbe(elapsed));
    EXPECT_LT(elapsed, kPromptMs);
    RecordProperty("detection_ms_with_gateway", std::to_string(elapsed));
    std::cout << "[ measured ] with a gateway: " << elapsed << " ms\n";
}

TEST(LabUpnpGateway, DetectorTellsItsWindowAboutTheGateway) {
    if (!UpnpLan::CanRun()) {
        GTEST_SKIP() << "needs root, ip and miniupnpd";
    }
    UpnpLan lan;
    ASSERT_TRUE(lan.Up(true));
    Inside inside(lan.Client());
    ASSERT_TRUE(inside.Entered());
    OwnerWindow window;
    ASSERT_TRUE(window.CreateMessageWindow());
    UpnpDetector detector;
    window.detector = &detector;
    ASSERT_EQ(detector.Start(window.Handle(), kDetected, 0), S_OK);
    ASSERT_TRUE(window.WaitForDeliveries(1));
    EXPECT_TRUE(window.deliveries[0].found);
    EXPECT_EQ(window.deliveries[0].message, kDetected);
}

TEST(LabUpnpNoGateway, ProbeAnswersFalseWithinTheBound) {
    if (!UpnpLan::CanRun()) {
        GTEST_SKIP() << "needs root, ip and miniupnpd";
    }
    UpnpLan lan;
    ASSERT_TRUE(lan.Up(false));
    Inside inside(lan.Client());
    ASSERT_TRUE(inside.Entered());
    int64_t elapsed = 0;
    EXPECT_FALSE(TimedProbe(elapsed));
    EXPECT_LT(elapsed, kPromptMs);
    RecordProperty("detection_ms_without_gateway", std::to_string(elapsed));
    std::cout << "[ measured ] without a gateway: " << elapsed << " ms\n";
}

TEST(LabUpnpNoGateway, DetectorReportsNoGatewayAndIsDestroyedMidSearchWithinTheBound) {
    if (!UpnpLan::CanRun()) {
        GTEST_SKIP() << "needs root, ip and miniupnpd";
    }
    UpnpLan lan;
    ASSERT_TRUE(lan.Up(false));
    Inside inside(lan.Client());
    ASSERT_TRUE(inside.Entered());
    OwnerWindow window;
    ASSERT_TRUE(window.CreateMessageWindow());
    auto detector = std::make_unique<UpnpDetector>();
    window.detector = detector.get();
    ASSERT_EQ(detector->Start(window.Handle(), kDetected, 0), S_OK);
    ASSERT_TRUE(window.WaitForDeliveries(1));
    EXPECT_FALSE(window.deliveries[0].found);

    ASSERT_EQ(detector->Start(window.Handle(), kDetected, 0), S_OK);
    platform::Sleep(platform::kUpnpSearchMs / 5);  // into the search
    window.detector = nullptr;
    const auto start = std::chrono::steady_clock::now();
    detector.reset();
    const auto elapsed = MillisecondsSince(start);
    platform::PumpPendingMessages();
    EXPECT_LT(elapsed, platform::kUpnpSearchMs + 500);
    EXPECT_EQ(window.deliveries.size(), 1u);
    std::cout << "[ measured ] destroyed mid-search after: " << elapsed << " ms\n";
}

}  // namespace
