#include "tools/nqpm/Discovery.h"

#include <cstdio>

#include "platform/kernel.h"
#include "platform/message.h"

namespace nqpm {

namespace {

std::string Text(HRESULT (IAdvancedPortManager::*getter)(BSTR*), IAdvancedPortManager* pm) {
    BStr value;
    (pm->*getter)(value.Out());
    return value.Utf8();
}

bool PortManagerRecommended(IAdvancedPortManager* pm) {
    ComPtr<IUnknown> unk;
    pm->get_RecommendedPortManager(unk.GetAddressOf());
    return static_cast<bool>(unk);
}

// The connection point of the port manager's events, or empty.
ComPtr<IConnectionPoint> EventsPoint(const ComPtr<IAdvancedPortManager>& pm) {
    ComPtr<IConnectionPoint> point;
    if (const auto container = pm.As<IConnectionPointContainer>()) {
        container->FindConnectionPoint(DIID__IAdvancedPortManagerEvents, point.GetAddressOf());
    }
    return point;
}

}  // namespace

const char* StateName(PM_STATE state) {
    switch (state) {
        case PMS_UNINITIALIZED:
            return "PMS_UNINITIALIZED";
        case PMS_INITIALIZING:
            return "PMS_INITIALIZING";
        case PMS_COMPLETED:
            return "PMS_COMPLETED";
    }
    return "invalid";
}

const char* TopologyName(PM_TOPOLOGY topology) {
    static const char* const names[] = {"PMT_UNKNOWN",
                                        "PMT_STUN_OPEN",
                                        "PMT_STUN_FULL_CONE_FIREWALL",
                                        "PMT_STUN_FULL_CONE_NAT",
                                        "PMT_STUN_RESTRICTED_CONE_NAT",
                                        "PMT_STUN_PORT_RESTRICTED_CONE_NAT",
                                        "PMT_STUN_SYMMETRIC_FIREWALL",
                                        "PMT_STUN_SYMMETRIC_NAT",
                                        "PMT_STUN_BLOCKED",
                                        "PMT_UPNP_ENABLED_NAT_OR_FIREWALL"};
    return topology >= 0 && topology <= PMT_UPNP_ENABLED_NAT_OR_FIREWALL ? names[topology]
                                                                         : "invalid";
}

std::vector<OptionSpec> DiscoveryOptionSpecs() {
    return {{"stun", true},     {"sip-proxy", true}, {"media-proxy", true}, {"no-upnp", false},
            {"no-stun", false}, {"timeout", true},   {"module", true}};
}

DiscoveryOptions ReadDiscoveryOptions(const Options& options) {
    DiscoveryOptions d;
    d.stunServers =
        options.Has("no-stun") && !options.Has("stun") ? std::string() : options.Required("stun");
    // The proxies are only texts to the port manager; check the port part when one is given.
    d.sipProxy = options.Value("sip-proxy");
    d.mediaProxy = options.Value("media-proxy");
    if (!d.sipProxy.empty()) {
        ParseHostPort("sip-proxy", d.sipProxy, 5060);
    }
    if (!d.mediaProxy.empty()) {
        ParseHostPort("media-proxy", d.mediaProxy, 5060);
    }
    d.upnp = !options.Has("no-upnp");
    d.stun = !options.Has("no-stun");
    d.timeoutSeconds = options.Seconds("timeout", 60);
    d.modulePath = options.Value("module");
    if (options.Has("log-level") || options.Has("log-folder")) {
        d.log.level =
            options.Has("log-level") ? static_cast<int>(options.Integer("log-level", 0, 4)) : 2;
    }
    if (options.Has("log-folder")) {
        d.log.folder = options.Value("log-folder");
    }
    return d;
}

Discovery::Discovery() = default;

Discovery::~Discovery() {
    if (m_pm) {
        if (m_cookie != 0) {
            if (const auto point = EventsPoint(m_pm)) {
                point->Unadvise(m_cookie);
            }
        }
        m_pm->Shutdown();
    }
}

HRESULT Discovery::QueryInterface(REFIID riid, void** ppv) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    if (riid == IID_IUnknown || riid == DIID__IAdvancedPortManagerEvents) {
        *ppv = static_cast<_IAdvancedPortManagerEvents*>(this);
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

HRESULT Discovery::Event(PM_EVENT type, IDispatch*) {
    if (type >= 0 && type < 4) {
        ++m_events[type];
    }
    if (type == PME_NETWORK_CHANGE && m_onNetworkChange) {
        m_onNetworkChange();
    }
    return S_OK;
}

int Discovery::Events(PM_EVENT type) const {
    return type >= 0 && type < 4 ? m_events[type] : 0;
}

bool Discovery::Run(const DiscoveryOptions& options) {
    RouteInterrupts();
    m_module.emplace(options.modulePath);
    HRESULT hr = m_module->Create(CLSID_AdvancedPortManager, IID_IAdvancedPortManager,
                                  m_pm.GetVoidAddressOf());
    if (FAILED(hr)) {
        std::fprintf(stderr, "nqpm: cannot create the port manager (0x%08X)\n",
                     static_cast<unsigned>(hr));
        return false;
    }
    const auto point = EventsPoint(m_pm);
    if (!point ||
        FAILED(point->Advise(static_cast<_IAdvancedPortManagerEvents*>(this), &m_cookie))) {
        std::fprintf(stderr, "nqpm: cannot connect to the port manager's events\n");
        return false;
    }

    m_module->ConfigureLogging(options.log, m_pm.Get());

    BStr servers(options.stunServers);
    BStr sip(options.sipProxy);
    BStr media(options.mediaProxy);
    hr = m_pm->InitializeEx2(servers.Get(), 5004, 16, sip.Get(), media.Get(),
                             options.upnp ? VARIANT_FALSE : VARIANT_TRUE,
                             options.stun ? VARIANT_FALSE : VARIANT_TRUE, 30000, VARIANT_TRUE,
                             VARIANT_TRUE, VARIANT_TRUE);
    if (FAILED(hr)) {
        std::fprintf(stderr, "nqpm: InitializeEx2 failed (0x%08X)\n", static_cast<unsigned>(hr));
        return false;
    }
    Progress("discovering the path to the Internet (UPnP gateway, then STUN)");
    const bool done = m_module->RunUntil([this] { return m_events[PME_UPDATED] > 0; },
                                         static_cast<int>(options.timeoutSeconds * 1000));
    if (!done && platform::InterruptRequested()) {
        std::fprintf(stderr, "nqpm: interrupted before the discovery reported\n");
        return false;
    }
    if (!done) {
        std::fprintf(stderr, "nqpm: no discovery outcome within %.0f s\n", options.timeoutSeconds);
        return false;
    }
    return true;
}

void Discovery::PumpFor(double seconds) {
    if (!m_module) {
        return;
    }
    m_module->RunUntil([] { return false; }, seconds < 0 ? -1 : static_cast<int>(seconds * 1000));
}

Discovery::Report Discovery::Read() const {
    Report r;
    VARIANT_BOOL upnp = VARIANT_FALSE;
    m_pm->get_State(&r.state);
    m_pm->get_Topology(&r.topology);
    m_pm->get_RecommendedUpnpEnabled(&upnp);
    r.upnp = upnp != VARIANT_FALSE;
    r.privateAddress = Text(&IAdvancedPortManager::get_PrivateIpAddress, m_pm.Get());
    r.publicAddress = Text(&IAdvancedPortManager::get_PublicIpAddress, m_pm.Get());
    r.sipServer = Text(&IAdvancedPortManager::get_RecommendedSipServer, m_pm.Get());
    r.suffix = Text(&IAdvancedPortManager::get_ClientNameSuffix, m_pm.Get());
    r.portManager = PortManagerRecommended(m_pm.Get());
    return r;
}

std::string Discovery::ReportText() const {
    const Report r = Read();
    std::string out;
    out += std::string("state:                    ") + StateName(r.state) + "\n";
    out += std::string("topology:                 ") + TopologyName(r.topology) + " (" +
           std::to_string(r.topology) + ")\n";
    out += "private address:          " + r.privateAddress + "\n";
    out += "public address:           " + r.publicAddress + "\n";
    out += "recommended SIP server:   " + r.sipServer + "\n";
    out += std::string("recommended UPnP enabled: ") + (r.upnp ? "yes" : "no") + "\n";
    out += "client name suffix:       " + r.suffix + "\n";
    out += std::string("port manager recommended: ") + (r.portManager ? "yes" : "no") + "\n";
    return out;
}

Json Discovery::ReportJson() const {
    const Report r = Read();
    return Json{{"state", StateName(r.state)},
                {"topology", TopologyName(r.topology)},
                {"topology_code", static_cast<int64_t>(r.topology)},
                {"private", r.privateAddress},
                {"public", r.publicAddress},
                {"recommended_sip_server", r.sipServer},
                {"recommended_upnp_enabled", r.upnp},
                {"client_name_suffix", r.suffix},
                {"recommended_port_manager", r.portManager}};
}

}  // namespace nqpm
