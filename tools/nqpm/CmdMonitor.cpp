// nqpm monitor: the usable local addresses, then one line per address or route change.
#include <cstdio>
#include <deque>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "foundation/NetUtils.h"
#include "foundation/NetworkChangeMonitor.h"
#include "platform/kernel.h"
#include "platform/message.h"
#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"

namespace nqpm {

namespace {

const char* const kUsage =
    "usage: nqpm monitor [--json]\n"
    "Prints the usable local IPv4 addresses (the first address of every interface with a\n"
    "default gateway), then one line per address change or route change with the new list,\n"
    "each after a 1 s settle pause, until Ctrl-C or SIGTERM (exit 0). With --json every line\n"
    "is {\"event\":\"start\"|\"addresses-changed\"|\"route-changed\",\"addresses\":[...]}.\n";

constexpr platform::UINT kWmChange = platform::WM_USER + 1;

struct Change {
    const char* event;
    std::vector<uint32_t> addresses;
};

// Takes the monitor's callbacks on its thread, with the list they were made for, and wakes the
// main thread's loop, which prints them in order.
class ChangeQueue : public foundation::INetworkChangeSink {
  public:
    ChangeQueue(const foundation::CNetworkChangeMonitor& monitor, platform::WindowHandle window)
        : monitor_(monitor), window_(window) {}

    void OnLocalIPsChanged() override { Push("addresses-changed"); }
    void OnRouteChanged() override { Push("route-changed"); }

    std::deque<Change> Take() {
        std::lock_guard<std::mutex> lock(mutex_);
        return std::exchange(changes_, {});
    }

  private:
    void Push(const char* event) {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            // The callback runs under the monitor's lock: this is the list it was rebuilt to.
            changes_.push_back({event, monitor_.GetLocalIPs()});
        }
        platform::PostMessage(window_, kWmChange, 0, 0);
    }

    const foundation::CNetworkChangeMonitor& monitor_;
    const platform::WindowHandle window_;
    std::mutex mutex_;
    std::deque<Change> changes_;
};

void Print(bool json, const Change& change) {
    if (json) {
        Json addresses = Json::array();
        for (uint32_t a : change.addresses) {
            addresses.push_back(foundation::FormatHostAddress(a));
        }
        PrintJson(Json{{"event", change.event}, {"addresses", std::move(addresses)}});
    } else {
        std::string line = std::string(change.event) + ":";
        for (uint32_t a : change.addresses) {
            line += " " + foundation::FormatHostAddress(a);
        }
        if (change.addresses.empty()) {
            line += " (none)";
        }
        std::printf("%s\n", line.c_str());
    }
    std::fflush(stdout);
}

// Stops the monitor before the sink goes, on every way out.
class Subscription {
  public:
    Subscription(foundation::CNetworkChangeMonitor& monitor, foundation::INetworkChangeSink* sink)
        : monitor_(monitor), sink_(sink) {
        monitor_.Subscribe(sink_);
    }
    ~Subscription() {
        monitor_.Stop();
        monitor_.Unsubscribe(sink_);
    }
    Subscription(const Subscription&) = delete;
    Subscription& operator=(const Subscription&) = delete;

  private:
    foundation::CNetworkChangeMonitor& monitor_;
    foundation::INetworkChangeSink* sink_;
};

class MonitorWindow : public platform::MessageWindow {
  public:
    explicit MonitorWindow(bool json) : json_(json) {}

    void SetQueue(ChangeQueue* queue) { queue_ = queue; }

    platform::LRESULT WindowProc(platform::UINT message, platform::WPARAM, platform::LPARAM,
                                 bool& handled) override {
        if (message == kWmChange && queue_ != nullptr) {
            for (const Change& c : queue_->Take()) {
                Print(json_, c);
            }
        } else {
            handled = false;
        }
        return 0;
    }

  private:
    const bool json_;
    ChangeQueue* queue_ = nullptr;
};

}  // namespace

int RunMonitor(int argc, char** argv) {
    Options options("monitor", {}, kUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kUsage, stdout);
        return kExitOk;
    }
    ConfigureLogging(options);
    RouteInterrupts();

    MonitorWindow window(options.Json());
    if (!window.CreateMessageWindow()) {
        std::fprintf(stderr, "nqpm monitor: cannot create the message window\n");
        return kExitFailed;
    }
    foundation::CNetworkChangeMonitor monitor;
    ChangeQueue queue(monitor, window.Handle());
    window.SetQueue(&queue);
    Subscription subscription(monitor, &queue);
    if (!monitor.Start()) {
        std::fprintf(stderr, "nqpm monitor: cannot start the network change monitor\n");
        return kExitFailed;
    }
    Print(options.Json(), {"start", monitor.GetLocalIPs()});
    Progress("watching address and route changes; Ctrl-C ends");
    platform::RunMessageLoop();  // until Ctrl-C or SIGTERM
    return kExitOk;
}

}  // namespace nqpm
