// The network change monitor. Which addresses count and the monitor's lifecycle are checked with
// a network-information double; the parse of the kernel's notifications with hand-made
// datagrams; real address and route changes in network namespaces that the "Lab" tests make
// (root only). Those wait for the fixed 1000 ms settle pause, so they are few and do several
// steps each.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstring>
#include <mutex>
#include <ostream>
#include <string>
#include <thread>
#include <vector>

#include "foundation/NetUtils.h"
#include "foundation/NetworkChangeMonitor.h"
#include "platform/kernel.h"
#include "platform/net.h"
#include "platform/netchange.h"
#include "platform/netinfo.h"
#include "platform/testing/netns.h"

namespace {

using foundation::CNetworkChangeMonitor;
using foundation::INetworkChangeSink;
using Addresses = std::vector<uint32_t>;
using Clock = std::chrono::steady_clock;

constexpr uint32_t Ip(uint32_t a, uint32_t b, uint32_t c, uint32_t d) {
    return (a << 24) | (b << 16) | (c << 8) | d;
}

int64_t MsSince(Clock::time_point start) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
}

// ---- Which addresses count, and the lifecycle (network-information double) -----------------

// Interfaces as the test describes them, changeable while the monitor's thread reads them. The
// address table lists its rows in the order given, which need not be the adapters' order.
// Counts the table queries made on the test's thread.
class ScriptedNetworkInfo : public platform::NetworkInfo {
  public:
    ScriptedNetworkInfo() { platform::InstallNetworkInfo(this); }
    ~ScriptedNetworkInfo() override { platform::InstallNetworkInfo(nullptr); }

    void Set(std::vector<platform::AdapterInfo> adapters, std::vector<uint32_t> table,
             bool tableOk = true, bool adaptersOk = true) {
        std::lock_guard<std::mutex> lock(mutex_);
        adapters_ = std::move(adapters);
        table_ = std::move(table);
        tableOk_ = tableOk;
        adaptersOk_ = adaptersOk;
    }
    int TableQueriesOnTestThread() const {
        std::lock_guard<std::mutex> lock(mutex_);
        return testThreadQueries_;
    }

    bool Adapters(std::vector<platform::AdapterInfo>& out) override {
        std::lock_guard<std::mutex> lock(mutex_);
        out = adaptersOk_ ? adapters_ : std::vector<platform::AdapterInfo>{};
        return adaptersOk_;
    }
    bool AddressTable(std::vector<platform::AddressRow>& out) override {
        std::lock_guard<std::mutex> lock(mutex_);
        testThreadQueries_ += std::this_thread::get_id() == testThread_ ? 1 : 0;
        out.clear();
        for (uint32_t address : table_) {
            out.push_back({address, 0});  // the monitor never looks at the index
        }
        return tableOk_;
    }
    int UdpInDatagrams(uint32_t& count) override {
        count = 0;
        return 0;
    }

  private:
    mutable std::mutex mutex_;
    std::vector<platform::AdapterInfo> adapters_;
    std::vector<uint32_t> table_;
    bool tableOk_ = true;
    bool adaptersOk_ = true;
    const std::thread::id testThread_ = std::this_thread::get_id();
    int testThreadQueries_ = 0;
};

// One interface whose only address has a gateway.
void SetSingleHost(ScriptedNetworkInfo& info, uint32_t address, bool tableOk = true,
                   bool adaptersOk = true) {
    info.Set({{2, "eth0", {foundation::FormatHostAddress(address)}, "198.51.100.1"}}, {address},
             tableOk, adaptersOk);
}

TEST(NetworkChangeMonitor, ListsTheFirstAddressOfEachInterfaceWithAGatewayInTableOrder) {
    ScriptedNetworkInfo info;
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
    CNetworkChangeMonitor monitor;
    EXPECT_TRUE(monitor.GetLocalIPs().empty());
    monitor.RefreshLocalIPs();
    EXPECT_EQ(monitor.GetLocalIPs(),
              (Addresses{Ip(172, 16, 0, 9), Ip(10, 0, 0, 5), Ip(127, 0, 0, 5)}));

    // A failed query of either kind leaves nothing listed.
    for (const auto& [tableOk, adaptersOk] : {std::pair{false, true}, std::pair{true, false}}) {
        SetSingleHost(info, Ip(10, 0, 0, 5));
        monitor.RefreshLocalIPs();
        ASSERT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 0, 0, 5)});
        SetSingleHost(info, Ip(10, 0, 0, 5), tableOk, adaptersOk);
        monitor.RefreshLocalIPs();
        EXPECT_TRUE(monitor.GetLocalIPs().empty()) << "table query ok: " << tableOk;
    }
}

TEST(NetworkChangeMonitor, StartRebuildsOnceOnTheCallerAndStopThenStartRebuildsAgain) {
    ScriptedNetworkInfo info;
    SetSingleHost(info, Ip(10, 0, 0, 5));
    const int descriptors = platform::CountOpenDescriptors();
    {
        CNetworkChangeMonitor monitor;
        monitor.Stop();  // idle: nothing to end
        ASSERT_TRUE(monitor.Start());
        EXPECT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 0, 0, 5)});
        EXPECT_EQ(info.TableQueriesOnTestThread(), 1);

        SetSingleHost(info, Ip(10, 0, 0, 6));
        EXPECT_TRUE(monitor.Start());
        EXPECT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 0, 0, 5)}) << "rebuilt while started";
        EXPECT_EQ(info.TableQueriesOnTestThread(), 1);

        monitor.Stop();
        EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
        ASSERT_TRUE(monitor.Start());
        EXPECT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 0, 0, 6)});
    }
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors) << "the destructor leaked";
}

// ---- The kernel's notifications -------------------------------------------------------------

// Kernel ABI values (linux/rtnetlink.h), spelled out because tests include no system header.
constexpr uint16_t kNewLink = 16, kNewAddr = 20, kDelAddr = 21, kNewRoute = 24, kDelRoute = 25;
constexpr size_t kHeaderSize = 16;

// A netlink message: header (length, type, flags, sequence, port id) and a payload, padded to
// four bytes unless told otherwise. declaredLength overrides the header's length field.
void AppendMessage(std::vector<uint8_t>& out, uint16_t type, size_t payload,
                   int64_t declaredLength = -1, bool pad = true) {
    const uint32_t length = declaredLength >= 0 ? static_cast<uint32_t>(declaredLength)
                                                : static_cast<uint32_t>(kHeaderSize + payload);
    uint8_t header[kHeaderSize] = {};
    std::memcpy(header, &length, 4);
    std::memcpy(header + 4, &type, 2);
    out.insert(out.end(), header, header + kHeaderSize);
    out.insert(out.end(), payload, 0xAB);
    while (pad && out.size() % 4 != 0) {
        out.push_back(0);
    }
}

TEST(NetworkChangeParse, NamesTheKindsOfEveryWholeMessageAndStopsAtABrokenOne) {
    struct Case {
        const char* name;
        std::vector<uint8_t> bytes;
        bool addresses;
        bool routes;
    };
    std::vector<Case> cases;
    const auto build = [](auto... steps) {
        std::vector<uint8_t> b;
        (steps(b), ...);
        return b;
    };
    const auto msg = [](uint16_t type, size_t payload, int64_t declared = -1, bool pad = true) {
        return [=](std::vector<uint8_t>& b) { AppendMessage(b, type, payload, declared, pad); };
    };
    cases.push_back({"empty", {}, false, false});
    cases.push_back({"new address", build(msg(kNewAddr, 24)), true, false});
    cases.push_back({"deleted address", build(msg(kDelAddr, 24)), true, false});
    cases.push_back({"new route", build(msg(kNewRoute, 36)), false, true});
    cases.push_back({"deleted route", build(msg(kDelRoute, 36)), false, true});
    cases.push_back({"link only", build(msg(kNewLink, 40)), false, false});
    cases.push_back({"address, link, route",
                     build(msg(kNewAddr, 8), msg(kNewLink, 4), msg(kDelRoute, 12)), true, true});
    cases.push_back({"odd length is padded to the next message",
                     build(msg(kNewLink, 3), msg(kNewRoute, 5)), false, true});
    cases.push_back(
        {"last message without its padding", build(msg(kNewAddr, 3, -1, false)), true, false});
    cases.push_back(
        {"shorter than a header", std::vector<uint8_t>(kHeaderSize - 1, 0), false, false});
    cases.push_back(
        {"length below the header", build(msg(kNewAddr, 8, kHeaderSize - 1)), false, false});
    cases.push_back(
        {"length beyond the datagram", build(msg(kNewAddr, 8, kHeaderSize + 9)), false, false});
    cases.push_back({"huge length", build(msg(kNewAddr, 8, 0xFFFFFFF0)), false, false});
    cases.push_back({"a whole message, then a cut one",
                     build(msg(kNewAddr, 8), msg(kNewRoute, 8, kHeaderSize + 100)), true, false});
    cases.push_back({"a whole message, then a stub",
                     build(msg(kNewRoute, 8), [](auto& b) { b.insert(b.end(), 6, 0); }), false,
                     true});
    for (const auto& c : cases) {
        // Misaligned on purpose: the datagram may start anywhere in the caller's buffer.
        std::vector<uint8_t> shifted(c.bytes.size() + 1);
        std::copy(c.bytes.begin(), c.bytes.end(), shifted.begin() + 1);
        const auto changes = platform::ParseNetworkChanges(shifted.data() + 1, c.bytes.size());
        EXPECT_EQ(changes.addresses, c.addresses) << c.name;
        EXPECT_EQ(changes.routes, c.routes) << c.name;
    }
    const auto none = platform::ParseNetworkChanges(nullptr, 64);
    EXPECT_FALSE(none.addresses || none.routes);
}

// ---- Real changes in a namespace of the test's own ----------------------------------------

constexpr int kEventTimeoutMs = 5000;

struct Notification {
    std::string sink;
    char kind;  // 'A' addresses, 'R' routes
    Addresses list;
    bool operator==(const Notification&) const = default;
};

std::ostream& operator<<(std::ostream& os, const Notification& n) {
    os << n.sink << ":" << n.kind << "[";
    for (uint32_t a : n.list) {
        os << foundation::FormatHostAddress(a) << " ";
    }
    return os << "]";
}

class NotificationLog {
  public:
    void Add(Notification n) {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            entries_.push_back(std::move(n));
        }
        changed_.notify_all();
    }
    bool WaitFor(size_t count, int timeoutMs = kEventTimeoutMs) {
        std::unique_lock<std::mutex> lock(mutex_);
        return changed_.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                                 [&] { return entries_.size() >= count; });
    }
    std::vector<Notification> Entries() const {
        std::lock_guard<std::mutex> lock(mutex_);
        return entries_;
    }

  private:
    mutable std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<Notification> entries_;
};

// Records each callback with the list the monitor holds at that moment.
class RecordingSink : public INetworkChangeSink {
  public:
    RecordingSink(std::string name, NotificationLog& log, const CNetworkChangeMonitor& monitor)
        : name_(std::move(name)), log_(log), monitor_(monitor) {}
    void OnLocalIPsChanged() override { log_.Add({name_, 'A', monitor_.GetLocalIPs()}); }
    void OnRouteChanged() override { log_.Add({name_, 'R', monitor_.GetLocalIPs()}); }

  private:
    std::string name_;
    NotificationLog& log_;
    const CNetworkChangeMonitor& monitor_;
};

// The system's answers, counting the address table reads of the monitor's own thread.
class CountingSystemInfo : public platform::NetworkInfo {
  public:
    CountingSystemInfo() { platform::InstallNetworkInfo(this); }
    ~CountingSystemInfo() override { platform::InstallNetworkInfo(nullptr); }
    bool Adapters(std::vector<platform::AdapterInfo>& out) override {
        return platform::SystemNetworkInfo().Adapters(out);
    }
    bool AddressTable(std::vector<platform::AddressRow>& out) override {
        if (std::this_thread::get_id() != testThread_) {
            ++otherThreadReads_;
        }
        return platform::SystemNetworkInfo().AddressTable(out);
    }
    int UdpInDatagrams(uint32_t& count) override {
        return platform::SystemNetworkInfo().UdpInDatagrams(count);
    }
    int MonitorThreadReads() const { return otherThreadReads_.load(); }

  private:
    const std::thread::id testThread_ = std::this_thread::get_id();
    std::atomic<int> otherThreadReads_{0};
};

// A namespace with a veth pair up and the test's thread inside it. With a default route through
// v0 (on-link, so it may exist before any address) the addresses of v0 count.
class LabNamespace {
  public:
    explicit LabNamespace(bool defaultRoute) : ns_("nqmon") {
        ok_ = ns_.IsValid() && ns_.Ip("link add v0 type veth peer name v1") &&
              ns_.Ip("link set v0 up") && ns_.Ip("link set v1 up") &&
              (!defaultRoute || ns_.Ip("route add default via 10.99.0.1 dev v0 onlink")) &&
              ns_.Enter();
    }
    bool Ok() const { return ok_; }
    platform::testing::ScopedNetns& Ns() { return ns_; }

  private:
    platform::testing::ScopedNetns ns_;
    bool ok_ = false;
};

#define SKIP_UNLESS_ROOT()                                  \
    do {                                                    \
        if (!platform::testing::IsRoot()) {                 \
            GTEST_SKIP() << "network namespaces need root"; \
        }                                                   \
    } while (0)

TEST(LabNetworkChangeMonitor, ListsOnlyTheFirstAddressOfInterfacesWithADefaultGateway) {
    SKIP_UNLESS_ROOT();
    LabNamespace lab(false);
    ASSERT_TRUE(lab.Ok());
    auto& ns = lab.Ns();
    CNetworkChangeMonitor monitor;

    monitor.RefreshLocalIPs();
    EXPECT_TRUE(monitor.GetLocalIPs().empty()) << "loopback only";

    ASSERT_TRUE(ns.Ip("addr add 10.99.0.10/24 dev v0"));
    ASSERT_TRUE(ns.Ip("addr add 10.98.0.20/24 dev v1"));
    monitor.RefreshLocalIPs();
    EXPECT_TRUE(monitor.GetLocalIPs().empty()) << "no default route";

    ASSERT_TRUE(ns.Ip("addr add 10.99.0.11/24 dev v0"));
    ASSERT_TRUE(ns.Ip("route add default via 10.99.0.1"));
    monitor.RefreshLocalIPs();
    EXPECT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 99, 0, 10)});
}

TEST(LabNetworkChangeMonitor, EveryNotificationGivesOnePassOverEverySinkWithTheNewList) {
    SKIP_UNLESS_ROOT();
    LabNamespace lab(true);
    ASSERT_TRUE(lab.Ok());
    auto& ns = lab.Ns();
    CountingSystemInfo info;
    NotificationLog log;
    CNetworkChangeMonitor monitor;
    RecordingSink a("a", log, monitor), b("b", log, monitor), never("never", log, monitor);
    monitor.Subscribe(&a);
    monitor.Subscribe(&b);
    monitor.Subscribe(&a);  // moves to the end: b is called first
    monitor.Subscribe(nullptr);
    monitor.Unsubscribe(&never);
    monitor.Unsubscribe(nullptr);
    ASSERT_TRUE(monitor.Start());
    EXPECT_TRUE(monitor.GetLocalIPs().empty());

    const Addresses one{Ip(10, 99, 0, 10)}, none;
    std::vector<Notification> expected;
    const auto pass = [&](char kind, const Addresses& list) {
        expected.push_back({"b", kind, list});
        expected.push_back({"a", kind, list});
    };
    // Each step waits for its passes, so that no two steps share a settle pause.
    const auto step = [&](const std::string& command) {
        if (!ns.Ip(command)) {
            ADD_FAILURE() << "failed: ip " << command;
            return false;
        }
        if (!log.WaitFor(expected.size())) {
            ADD_FAILURE() << "no pass after " << command;
            return false;
        }
        return true;
    };
    // A new address also adds routes: the address pass comes first, then one route pass.
    pass('A', one);
    pass('R', one);
    ASSERT_TRUE(step("addr add 10.99.0.10/24 dev v0"));
    pass('R', one);  // addresses unchanged
    ASSERT_TRUE(step("route add 203.0.113.0/24 via 10.99.0.1"));
    EXPECT_EQ(info.MonitorThreadReads(), 3) << "one rebuild per pass";
    pass('R', none);
    ASSERT_TRUE(step("route del default"));
    pass('A', none);
    pass('R', none);
    ASSERT_TRUE(step("addr del 10.99.0.10/24 dev v0"));

    // Longer than a settle pause: a surplus pass would show up now.
    std::this_thread::sleep_for(std::chrono::milliseconds(CNetworkChangeMonitor::kSettleMs + 500));
    monitor.Stop();
    EXPECT_EQ(log.Entries(), expected);
    EXPECT_EQ(info.MonitorThreadReads(), 6);
}

TEST(LabNetworkChangeMonitor, StopInTheSettlePauseEndsAtOnceAndStartWorksAgain) {
    SKIP_UNLESS_ROOT();
    LabNamespace lab(true);
    ASSERT_TRUE(lab.Ok());
    auto& ns = lab.Ns();
    NotificationLog log;
    CNetworkChangeMonitor monitor;
    RecordingSink sink("s", log, monitor);
    monitor.Subscribe(&sink);
    const int descriptors = platform::CountOpenDescriptors();
    ASSERT_TRUE(monitor.Start());

    ASSERT_TRUE(ns.Ip("addr add 10.99.0.10/24 dev v0"));
    std::this_thread::sleep_for(std::chrono::milliseconds(200));  // well inside the pause
    const auto stopping = Clock::now();
    monitor.Stop();
    EXPECT_LT(MsSince(stopping), 300);
    EXPECT_TRUE(log.Entries().empty()) << "a pass ran after Stop";
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);

    ASSERT_TRUE(monitor.Start());
    EXPECT_EQ(monitor.GetLocalIPs(), Addresses{Ip(10, 99, 0, 10)});
    ASSERT_TRUE(ns.Ip("route add 203.0.113.0/24 via 10.99.0.1"));
    ASSERT_TRUE(log.WaitFor(1));
    monitor.Stop();
    EXPECT_EQ(log.Entries(), (std::vector<Notification>{{"s", 'R', {Ip(10, 99, 0, 10)}}}));
    EXPECT_EQ(platform::CountOpenDescriptors(), descriptors);
}

}  // namespace
