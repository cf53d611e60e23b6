// A port manager driven as a softphone drives it: created on this thread, a sink connected,
// initialised, and its message loop pumped until the discovery reports.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include <nqportmanager/NqPortManager.h>

#include "tools/nqpm/Cli.h"
#include "tools/nqpm/ModuleClient.h"

namespace nqpm {

struct DiscoveryOptions {
    std::string stunServers;
    std::string sipProxy;
    std::string mediaProxy;
    bool upnp = true;
    bool stun = true;
    double timeoutSeconds = 60;
    std::string modulePath;  // empty: the registered module, else the one beside nqpm
    LogSettings log;
};

// The options common to `discover` and `profile`.
std::vector<OptionSpec> DiscoveryOptionSpecs();
DiscoveryOptions ReadDiscoveryOptions(const Options& options);

class Discovery final : public _IAdvancedPortManagerEvents {
  public:
    Discovery();
    ~Discovery();
    Discovery(const Discovery&) = delete;
    Discovery& operator=(const Discovery&) = delete;

    // Creates, connects and initialises; pumps until the first PME_UPDATED. False (with a
    // message on stderr) on failure or time-out.
    bool Run(const DiscoveryOptions& options);
    // Pumps until the time passes or Ctrl-C / SIGTERM; -1 waits for the interrupt only.
    void PumpFor(double seconds);

    IAdvancedPortManager* PortManager() const { return m_pm.Get(); }
    // The module the port manager came from (after Run).
    const ModuleClient& Module() const { return *m_module; }
    // The state, topology, addresses and recommendations, as text lines or one JSON object.
    std::string ReportText() const;
    Json ReportJson() const;

    int Events(PM_EVENT type) const;
    // Called for every PME_NETWORK_CHANGE after the first update.
    void OnNetworkChange(std::function<void()> callback) {
        m_onNetworkChange = std::move(callback);
    }

    HRESULT QueryInterface(REFIID riid, void** ppv) override;
    ULONG AddRef() override { return 2; }  // lives on the stack of its command
    ULONG Release() override { return 1; }
    HRESULT Event(PM_EVENT type, IDispatch* event) override;

  private:
    struct Report {
        PM_STATE state = PMS_UNINITIALIZED;
        PM_TOPOLOGY topology = PMT_UNKNOWN;
        std::string privateAddress;
        std::string publicAddress;
        std::string sipServer;
        std::string suffix;
        bool upnp = false;
        bool portManager = false;
    };
    Report Read() const;

    std::optional<ModuleClient> m_module;  // outlives the port manager
    ComPtr<IAdvancedPortManager> m_pm;
    DWORD m_cookie = 0;
    int m_events[4] = {0, 0, 0, 0};
    std::function<void()> m_onNetworkChange;
};

const char* StateName(PM_STATE state);
const char* TopologyName(PM_TOPOLOGY topology);

}  // namespace nqpm
