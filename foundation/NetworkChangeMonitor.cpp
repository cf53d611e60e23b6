#include "foundation/NetworkChangeMonitor.h"

#include <algorithm>

#include "foundation/Logger.h"
#include "foundation/NetUtils.h"
#include "platform/netchange.h"

namespace foundation {

namespace {
constexpr uint32_t kAnyAddress = 0x00000000u;
constexpr uint32_t kLoopbackAddress = 0x7F000001u;
constexpr uint32_t kBroadcastAddress = 0xFFFFFFFFu;
}  // namespace

CNetworkChangeMonitor::CNetworkChangeMonitor(platform::NetworkInfo& info) : m_info(info) {}

CNetworkChangeMonitor::~CNetworkChangeMonitor() {
    Stop();
}

void CNetworkChangeMonitor::Subscribe(INetworkChangeSink* sink) {
    if (sink == nullptr) {
        return;
    }
    platform::CriticalSectionLock lock(m_lock);
    Unsubscribe(sink);
    m_sinks.push_back(sink);
}

void CNetworkChangeMonitor::Unsubscribe(INetworkChangeSink* sink) {
    if (sink == nullptr) {
        return;
    }
    platform::CriticalSectionLock lock(m_lock);
    const auto it = std::find(m_sinks.begin(), m_sinks.end(), sink);
    if (it != m_sinks.end()) {
        m_sinks.erase(it);
    }
}

bool CNetworkChangeMonitor::Start() {
    std::lock_guard<std::mutex> lifecycle(m_lifecycle);
    if (m_thread.IsStarted()) {
        return true;
    }
    // Subscribed before the list is read, so that no change after the rebuild goes unnoticed.
    auto watcher = std::make_unique<platform::NetworkChangeWatcher>();
    if (!watcher->IsOpen()) {
        // The thread then ends at once and Start keeps answering true until Stop: the list is
        // still served, it is just not kept up to date.
        NQ_LOG("CNetworkChangeMonitor::Start", kLogError, "%s",
               "Cannot watch for address and route changes");
    }
    RefreshLocalIPs();
    m_watcher = std::move(watcher);
    if (!m_thread.Start([this] { MonitorThread(); })) {
        m_watcher.reset();
        return false;
    }
    return true;
}

void CNetworkChangeMonitor::Stop() {
    std::lock_guard<std::mutex> lifecycle(m_lifecycle);
    if (!m_thread.IsStarted()) {
        return;
    }
    if (m_thread.IsCurrentThread()) {
        // From a callback: the thread cannot join itself. It ends after this pass; the owner's
        // next Stop joins it.
        m_thread.RequestStop();
        return;
    }
    // Not under m_lock: the thread may need it to finish its callback pass.
    m_thread.Stop();
    m_watcher.reset();
}

std::vector<uint32_t> CNetworkChangeMonitor::GetLocalIPs() const {
    platform::CriticalSectionLock lock(m_lock);
    return m_localIPs;
}

void CNetworkChangeMonitor::RefreshLocalIPs() {
    platform::CriticalSectionLock lock(m_lock);
    std::vector<uint32_t>().swap(m_localIPs);
    std::vector<platform::AddressRow> table;
    if (!m_info.AddressTable(table)) {
        return;
    }
    for (const auto& row : table) {
        const uint32_t address = row.hostAddress;
        if (address == kAnyAddress || address == kLoopbackAddress || address == kBroadcastAddress) {
            continue;
        }
        // Only an interface's first address with a default gateway counts.
        if (!GetGatewayForLocalAddress(FormatHostAddress(address), m_info).empty()) {
            m_localIPs.push_back(address);
        }
    }
}

void CNetworkChangeMonitor::MonitorThread() {
    constexpr const char* kFunction = "CNetworkChangeMonitor::MonitorThread";
    if (!m_watcher->IsOpen()) {
        return;
    }
    // Notifications that arrive during a pass's settle pause lead to a further pass, as the
    // kernel keeps queueing them on the watcher meanwhile.
    bool addressPending = false;
    bool routePending = false;
    for (;;) {
        if (!addressPending && !routePending) {
            const auto r = platform::WaitReadable(m_watcher->Descriptor(), -1);
            if (r == platform::WaitResult::Stopped) {
                return;
            }
            if (r == platform::WaitResult::Failed) {
                // Retrying would spin on a descriptor that poll refuses.
                NQ_LOG(kFunction, kLogError, "%s", "Waiting for address and route changes failed");
                return;
            }
        }
        const platform::NetworkChanges changes = m_watcher->Read();
        if (changes.failed) {
            // A broken socket stays readable: waiting on it again would spin.
            NQ_LOG(kFunction, kLogError, "%s", "Reading address and route changes failed");
            return;
        }
        addressPending = addressPending || changes.addresses;
        routePending = routePending || changes.routes;
        // Addresses first; a pending route change is served on the next turn.
        if (addressPending) {
            addressPending = false;
            if (!SettleAndNotify(&INetworkChangeSink::OnLocalIPsChanged)) {
                return;
            }
        } else if (routePending) {
            routePending = false;
            if (!SettleAndNotify(&INetworkChangeSink::OnRouteChanged)) {
                return;
            }
        }
    }
}

bool CNetworkChangeMonitor::SettleAndNotify(void (INetworkChangeSink::*callback)()) {
    if (platform::Sleep(kSettleMs) == platform::WaitResult::Stopped) {
        return false;
    }
    platform::CriticalSectionLock lock(m_lock);
    RefreshLocalIPs();
    // By index: a misbehaving sink that unsubscribes in its callback must not invalidate us.
    for (size_t i = 0; i < m_sinks.size(); ++i) {
        (m_sinks[i]->*callback)();
    }
    return true;
}

}  // namespace foundation
