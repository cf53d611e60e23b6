// Watches the local IPv4 addresses and the routing table, keeps the list of usable local
// addresses and calls back the objects that subscribed to it.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/kernel.h"
#include "platform/netinfo.h"

namespace platform {
class NetworkChangeWatcher;
}

namespace foundation {

// Callbacks of a monitor's subscribers. They run on the monitor's thread with its lock held, so a
// sink returns quickly, does not wait for a thread that may be inside the same monitor, and
// neither subscribes, unsubscribes nor stops the monitor from within a callback.
class INetworkChangeSink {
  public:
    virtual void OnLocalIPsChanged() = 0;
    virtual void OnRouteChanged() = 0;

  protected:
    // The monitor never owns or deletes a sink.
    ~INetworkChangeSink() = default;
};

class CNetworkChangeMonitor {
  public:
    // Lets a burst of changes settle before the address table is read.
    static constexpr int kSettleMs = 1000;

    // Reads the address table and gateways from info, which outlives the monitor.
    explicit CNetworkChangeMonitor(platform::NetworkInfo& info = platform::SystemNetworkInfo());
    ~CNetworkChangeMonitor();
    CNetworkChangeMonitor(const CNetworkChangeMonitor&) = delete;
    CNetworkChangeMonitor& operator=(const CNetworkChangeMonitor&) = delete;

    // Appends the sink, moving it to the end when it is already listed. Null is ignored.
    void Subscribe(INetworkChangeSink* sink);
    // Removes the sink; null or a sink that is not listed is ignored.
    void Unsubscribe(INetworkChangeSink* sink);

    // Rebuilds the list on the calling thread, then starts the monitor thread. True at once,
    // without a rebuild, when already started; false when no thread could be created.
    bool Start();
    // Ends the monitor thread (after a callback pass in progress, never within one). The sinks
    // stay subscribed.
    void Stop();

    // The usable local addresses, host order, in the order of the system's address table.
    std::vector<uint32_t> GetLocalIPs() const;
    // The first address of every interface with a default gateway, except 0.0.0.0, 127.0.0.1
    // and 255.255.255.255.
    void RefreshLocalIPs();

  private:
    void MonitorThread();
    // The settle pause, a rebuild and one callback pass; false when asked to stop in the pause.
    bool SettleAndNotify(void (INetworkChangeSink::*callback)());

    platform::NetworkInfo& m_info;
    std::vector<uint32_t> m_localIPs;
    std::vector<INetworkChangeSink*> m_sinks;
    mutable platform::CriticalSection m_lock;  // both lists, and held during callback passes

    std::mutex m_lifecycle;  // Start and Stop, so any thread may call them
    std::unique_ptr<platform::NetworkChangeWatcher> m_watcher;  // used by the thread only
    platform::Thread m_thread;
};

}  // namespace foundation
