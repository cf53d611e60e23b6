// The network change monitor. Which addresses count and the lifecycle are checked with a
// network-information double; the parse of the kernel's notifications with hand-made
// datagrams; real address and route changes in network namespaces that the "Lab" tests make
// (root only). Those wait for the fixed 1000 ms settle pause, so they are few.
#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstring>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "foundation/NetUtils.h"
#include "foundation/NetworkChangeMonitor.h"
#include "platform/kernel.h"
#include "platform/net.h"
#include "platform/netchange.h"
#include "platform/netinfo.h"
#include "tests/support/os/netns.h"

namespace {

using foundation::CNetworkChangeMonitor;
using Addresses = std::vector<uint32_t>;
using Clock = std::chrono::steady_clock;

constexpr uint32_t Ip(uint32_t a, uint32_t b, uint32_t c, uint32_t d) {
    return (a << 24) | (b << 16) | (c << 8) | d;
}

// Answers as the system until Set scripts it (the address table in the order given, which need
// not be the adapters' order). Counts address table reads on the test's thread and on others.
// Locked: the monitor's thread reads while the test changes it.
class TestNetworkInfo : public platform::NetworkInfo {
  public:
    void Set(std::vector<platform::AdapterInfo> adapters, Addresses table, bool tableOk = true,
             bool adaptersOk = true) {
        std::lock_guard<std::mutex> lock(mutex_);
        scripted_ = true;
        adapters_ = std::move(adapters);
        table_ = std::move(table);
        tableOk_ = tableOk;
        adaptersOk_ = adaptersOk;
    }
    // One interface whose only address has a gateway.
    void SetSingleHost(uint32_t address, bool tableOk = true, bool adaptersOk = true) {
        Set({{2, "eth0", {foundation::FormatHostAddress(address)}, "198.51.100.1"}}, {address},
            tableOk, adaptersOk);
    }
    int Reads(bool onTestThread) const {
        std::lock_guard<std::mutex> lock(mutex_);
        return reads_[onTestThread ? 1 : 0];
    }

    bool Adapters(std::vector<platform::AdapterInfo>& out) override {
        std::lock_guard<std::mutex> lock(mutex_);
        if (!scripted_) {
            return platform::SystemNetworkInfo().Adapters(out);
        }
        out = adaptersOk_ ? adapters_ : std::vector<platform::AdapterInfo>{};
        return adaptersOk_;
    }
    bool AddressTable(std::vector<platform::AddressRow>& out) override {
        std::lock_guard<std::mutex> lock(mutex_);
        ++reads_[std::this_thread::get_id() == testThread_ ? 1 : 0];
        if (!scripted_) {
            return platform::SystemNetworkInfo().AddressTable(out);
        }
        out.clear();
        for (uint32_t address : table_) {
            out.push_back({address, 0});  // the monitor never looks at the index
        }
        return tableOk_;
    }
    int UdpInDatagrams(uint32_t& count) override {
        return platform::SystemNetworkInfo().UdpInDatagrams(count);
    }

  private:
    mutable std::mutex mutex_;
    bool scripted_ = false;
    std::vector<platform::AdapterInfo> adapters_;
    Addresses table_;
    bool tableOk_ = true;
    bool adaptersOk_ = true;
    const std::thread::id testThread_ = std::this_thread::get_id();
    int reads_[2] = {0, 0};
};

TEST(NetworkChangeMonitor, ListsTheFirstAddressOfEachInterfaceWithAGatewayInTableOrder) {
    TestNetworkInfo info;
    // Every excluded address but the secondary one heads an adapter with a gateway, so that
    // only the rule under test can keep it out.
    info.Set({{2, "eth1", {"10.0.0.5", "10.0.0.6"}, "10.0.0.1"},
              {3, "eth2", {"192.168.1.7"}, ""},
              {4, "eth3", {"172.16.0.9"}, "172.16.0.1"},
              {1, "lo", {"127.0.0.1"}, "127.0.0.254"},
              {5, "lo5", {"127.0.0.5"}, "127.0.0.254"},
              {6, "any", {"0.0.0.0"}, "10.0.0.1"},
              {7, "bcast", {"255.255.255.255"}, "10.0.0.1"}},
             {Ip(172, 16, 0, 9), 0, Ip(127, 0, 0, 1), Ip(10, 0, 0, 5), Ip(10, 0, 0, 6),
              Ip(192, 168, 1, 7), 0xFFFFFFFF, Ip(127, 0, 0, 5)});
    CNetworkChangeMonitor monitor(info);
    EXPECT_TRUE(monitor.GetLocalIPs().empty());
    monitor.RefreshLocalIPs();
    EXPECT_EQ(monitor.GetLocalIPs(),
              (Addresses{Ip(172, 16, 0, 9), Ip(10, 0, 0, 5), Ip(127, 0, 0, 5)}));

    // A failed query of either kind leaves nothing listed.
    for (const auto& [tableOk, adaptersOk] : {std::pair{false, true}, std::pair{true, false}}) {
        info.SetSingleHost(Ip(10, 0, 0, 5));
        monitor.RefreshLocalIPs();
        ASSERT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 0, 0, 5)});
        info.SetSingleHost(Ip(10, 0, 0, 5), tableOk, adaptersOk);
        monitor.RefreshLocalIPs();
        EXPECT_TRUE(monitor.GetLocalIPs().empty()) << "table query ok: " << tableOk;
    }
}

TEST(NetworkChangeMonitor, StartRebuildsOnceOnTheCallerAndStopThenStartRebuildsAgain) {
    TestNetworkInfo info;
    info.SetSingleHost(Ip(10, 0, 0, 5));
    const int descriptors = platform::CountOpenDescriptors();
    {
        CNetworkChangeMonitor monitor(info);
        monitor.Stop();  // idle: nothing to end
        ASSERT_TRUE(monitor.Start());
        EXPECT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 0, 0, 5)});
        EXPECT_EQ(info.Reads(true), 1);

        info.SetSingleHost(Ip(10, 0, 0, 6));
        EXPECT_TRUE(monitor.Start());
        EXPECT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 0, 0, 5)}) << "rebuilt while started";
        EXPECT_EQ(info.Reads(true), 1);

        monitor.Stop();
        EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
        ASSERT_TRUE(monitor.Start());
        EXPECT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 0, 0, 6)});
    }
}

// Kernel ABI values (linux/rtnetlink.h), spelled out because tests include no system header.
constexpr uint16_t kNewLink = 16, kNewAddr = 20, kDelAddr = 21, kNewRoute = 24, kDelRoute = 25;
constexpr uint32_t kHeaderSize = 16;

// Netlink messages: header (length, type, flags, sequence, port id) and a payload, padded to
// four bytes unless told otherwise. declared overrides the header's length field.
struct Datagram {
    Datagram& Msg(uint16_t type, uint32_t payload, int64_t declared = -1, bool pad = true) {
        const uint32_t length =
            declared >= 0 ? static_cast<uint32_t>(declared) : kHeaderSize + payload;
        uint8_t header[kHeaderSize] = {};
        std::memcpy(header, &length, 4);
        std::memcpy(header + 4, &type, 2);
        bytes.insert(bytes.end(), header, header + kHeaderSize);
        bytes.insert(bytes.end(), payload, 0xAB);
        while (pad && bytes.size() % 4 != 0) {
            bytes.push_back(0);
        }
        return *this;
    }
    Datagram& Zeros(size_t count) {
        bytes.insert(bytes.end(), count, 0);
        return *this;
    }
    std::vector<uint8_t> bytes;
};

TEST(NetworkChangeParse, NamesTheKindsOfEveryWholeMessageAndStopsAtABrokenOne) {
    const struct {
        const char* name;
        Datagram datagram;
        bool addresses, routes;
    } cases[] = {
        {"empty", {}, false, false},
        {"new address", Datagram().Msg(kNewAddr, 24), true, false},
        {"deleted address", Datagram().Msg(kDelAddr, 24), true, false},
        {"new route", Datagram().Msg(kNewRoute, 36), false, true},
        {"deleted route", Datagram().Msg(kDelRoute, 36), false, true},
        {"link only", Datagram().Msg(kNewLink, 40), false, false},
        {"address, link, route", Datagram().Msg(kNewAddr, 8).Msg(kNewLink, 4).Msg(kDelRoute, 12),
         true, true},
        {"odd length is padded to the next message", Datagram().Msg(kNewLink, 3).Msg(kNewRoute, 5),
         false, true},
        {"last message without its padding", Datagram().Msg(kNewAddr, 3, -1, false), true, false},
        {"shorter than a header", Datagram().Zeros(kHeaderSize - 1), false, false},
        {"length below the header", Datagram().Msg(kNewAddr, 8, kHeaderSize - 1), false, false},
        {"length beyond the datagram", Datagram().Msg(kNewAddr, 8, kHeaderSize + 9), false, false},
        {"huge length", Datagram().Msg(kNewAddr, 8, 0xFFFFFFF0), false, false},
        {"a whole message, then a cut one",
         Datagram().Msg(kNewAddr, 8).Msg(kNewRoute, 8, kHeaderSize + 100), true, false},
        {"a whole message, then a stub", Datagram().Msg(kNewRoute, 8).Zeros(6), false, true},
    };
    for (const auto& c : cases) {
        // Misaligned on purpose: the datagram may start anywhere in the caller's buffer.
        std::vector<uint8_t> shifted(1);
        shifted.insert(shifted.end(), c.datagram.bytes.begin(), c.datagram.bytes.end());
        const auto changes = platform::ParseNetworkChanges(shifted.data() + 1, shifted.size() - 1);
        EXPECT_EQ(changes.addresses, c.addresses) << c.name;
        EXPECT_EQ(changes.routes, c.routes) << c.name;
    }
    const auto none = platform::ParseNetworkChanges(nullptr, 64);
    EXPECT_FALSE(none.addresses || none.routes);
}

// A namespace with a veth pair up, the test's thread inside it (the namespace's destructor takes
// it out) and a monitor made there. Sinks record each callback as "<sink><kind> <list>" with
// the list the monitor holds then.
class LabNetworkChangeMonitor : public ::testing::Test {
  protected:
    void SetUp() override {
        if (!platform::testing::IsRoot()) {
            GTEST_SKIP() << "network namespaces need root";
        }
        ns_.emplace("nqmon");
        ASSERT_TRUE(ns_->IsValid() && IpCommand("link add v0 type veth peer name v1") &&
                    IpCommand("link set v0 up") && IpCommand("link set v1 up") && ns_->Enter());
        monitor_.emplace(info_);
    }
    bool IpCommand(const std::string& command) { return ns_->Ip(command); }
    // On-link, so it may exist before any address; makes the addresses of v0 count.
    bool AddDefaultRoute() { return IpCommand("route add default via 10.99.0.1 dev v0 onlink"); }

    struct Sink : foundation::INetworkChangeSink {
        Sink(LabNetworkChangeMonitor* lab, std::string name) : lab(lab), name(std::move(name)) {}
        void OnLocalIPsChanged() override { lab->Record(name + "A"); }
        void OnRouteChanged() override { lab->Record(name + "R"); }
        LabNetworkChangeMonitor* lab;
        std::string name;
    };
    void Record(std::string entry) {
        for (uint32_t address : monitor_->GetLocalIPs()) {
            entry += " " + foundation::FormatHostAddress(address);
        }
        std::lock_guard<std::mutex> lock(mutex_);
        log_.push_back(entry);
        logged_.notify_all();
    }
    bool WaitForLog(size_t count) {
        std::unique_lock<std::mutex> lock(mutex_);
        return logged_.wait_for(lock, std::chrono::milliseconds(5000),
                                [&] { return log_.size() >= count; });
    }
    std::vector<std::string> Log() {
        std::lock_guard<std::mutex> lock(mutex_);
        return log_;
    }

    // Destroyed in reverse: the monitor ends before what its thread uses.
    std::optional<platform::testing::ScopedNetns> ns_;
    TestNetworkInfo info_;
    std::mutex mutex_;
    std::condition_variable logged_;
    std::vector<std::string> log_;
    Sink a_{this, "a"}, b_{this, "b"}, never_{this, "never"};
    std::optional<CNetworkChangeMonitor> monitor_;
};

TEST_F(LabNetworkChangeMonitor, OnePassPerNotificationOverEverySinkAndStopInThePauseEndsIt) {
    ASSERT_TRUE(AddDefaultRoute());
    auto& monitor = *monitor_;
    monitor.Subscribe(&a_);
    monitor.Subscribe(&b_);
    monitor.Subscribe(&a_);  // moves to the end: b is called first
    monitor.Subscribe(nullptr);
    monitor.Unsubscribe(&never_);
    monitor.Unsubscribe(nullptr);
    const int descriptors = platform::CountOpenDescriptors();
    ASSERT_TRUE(monitor.Start());
    EXPECT_TRUE(monitor.GetLocalIPs().empty());

    std::vector<std::string> expected;
    const auto pass = [&](const std::string& kindAndList) {
        expected.push_back("b" + kindAndList);
        expected.push_back("a" + kindAndList);
    };
    // Each step waits for its passes, so that no two steps share a settle pause.
    const auto step = [&](const std::string& command) {
        return IpCommand(command) && WaitForLog(expected.size());
    };
    // A new address also adds routes: the address pass comes first, then one route pass.
    pass("A 10.99.0.10");
    pass("R 10.99.0.10");
    ASSERT_TRUE(step("addr add 10.99.0.10/24 dev v0"));
    pass("R 10.99.0.10");  // addresses unchanged
    ASSERT_TRUE(step("route add 203.0.113.0/24 via 10.99.0.1"));
    EXPECT_EQ(info_.Reads(false), 3) << "one rebuild per pass";
    pass("R");
    ASSERT_TRUE(step("route del default"));
    pass("A");
    pass("R");
    ASSERT_TRUE(step("addr del 10.99.0.10/24 dev v0"));
    // Longer than a settle pause: a surplus pass would show up now.
    std::this_thread::sleep_for(std::chrono::milliseconds(CNetworkChangeMonitor::kSettleMs + 500));
    monitor.Stop();
    EXPECT_EQ(Log(), expected);
    EXPECT_EQ(info_.Reads(false), 6);
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);

    // Stopped inside a settle pause: no pass then, none left over for the next Start.
    ASSERT_TRUE(AddDefaultRoute());
    ASSERT_TRUE(monitor.Start());
    ASSERT_TRUE(IpCommand("addr add 10.99.0.10/24 dev v0"));
    std::this_thread::sleep_for(std::chrono::milliseconds(200));  // well inside the pause
    const auto stopping = Clock::now();
    monitor.Stop();
    EXPECT_LT(Clock::now() - stopping, std::chrono::milliseconds(300));
    EXPECT_EQ(Log(), expected) << "a pass ran after Stop";
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
    ASSERT_TRUE(monitor.Start());
    EXPECT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 99, 0, 10)});
    pass("R 10.99.0.10");
    ASSERT_TRUE(step("route add 198.51.100.0/24 via 10.99.0.1"));
    monitor.Stop();
    EXPECT_EQ(Log(), expected);
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
}

}  // namespace
