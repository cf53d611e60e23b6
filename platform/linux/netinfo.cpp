#include "platform/netinfo.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <net/route.h>
#include <netinet/in.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <fstream>
#include <map>
#include <sstream>

namespace platform {

namespace {

struct DefaultRoute {
    uint32_t gatewayNet;
    unsigned metric;
};

// Default routes with a gateway, by interface name, lowest metric first (main table). Read
// through thread-self so a thread that entered another network namespace sees that one.
std::map<std::string, DefaultRoute> ReadDefaultGateways() {
    std::map<std::string, DefaultRoute> result;
    std::ifstream in("/proc/thread-self/net/route");
    std::string line;
    std::getline(in, line);  // header
    while (std::getline(in, line)) {
        std::istringstream fields(line);
        std::string iface;
        unsigned long dest = 0, gateway = 0, flags = 0, refcnt = 0, use = 0, metric = 0, mask = 0;
        fields >> iface >> std::hex >> dest >> gateway >> flags >> std::dec >> refcnt >> use >>
            metric >> std::hex >> mask;
        if (!fields || dest != 0 || mask != 0 || (flags & RTF_UP) == 0 ||
            (flags & RTF_GATEWAY) == 0) {
            continue;
        }
        auto it = result.find(iface);
        if (it == result.end() || metric < it->second.metric) {
            result[iface] =
                DefaultRoute{static_cast<uint32_t>(gateway), static_cast<unsigned>(metric)};
        }
    }
    return result;
}

class LinuxNetworkInfo final : public NetworkInfo {
  public:
    bool Adapters(std::vector<AdapterInfo>& out) override {
        out.clear();
        ifaddrs* list = nullptr;
        if (getifaddrs(&list) != 0) {
            return false;
        }
        const auto gateways = ReadDefaultGateways();
        for (ifaddrs* p = list; p != nullptr; p = p->ifa_next) {
            if (p->ifa_addr == nullptr || p->ifa_addr->sa_family != AF_INET) {
                continue;
            }
            AdapterInfo* adapter = nullptr;
            for (auto& a : out) {
                if (a.name == p->ifa_name) {
                    adapter = &a;
                }
            }
            if (adapter == nullptr) {
                AdapterInfo fresh;
                fresh.name = p->ifa_name;
                fresh.index = if_nametoindex(p->ifa_name);
                auto gw = gateways.find(fresh.name);
                if (gw != gateways.end()) {
                    char text[INET_ADDRSTRLEN] = {};
                    in_addr a{};
                    a.s_addr = gw->second.gatewayNet;
                    inet_ntop(AF_INET, &a, text, sizeof text);
                    fresh.gateway = text;
                }
                out.push_back(std::move(fresh));
                adapter = &out.back();
            }
            char text[INET_ADDRSTRLEN] = {};
            inet_ntop(AF_INET, &reinterpret_cast<const sockaddr_in*>(p->ifa_addr)->sin_addr, text,
                      sizeof text);
            adapter->addresses.emplace_back(text);
        }
        freeifaddrs(list);
        return true;
    }

    bool AddressTable(std::vector<AddressRow>& out) override {
        out.clear();
        ifaddrs* list = nullptr;
        if (getifaddrs(&list) != 0) {
            return false;
        }
        for (ifaddrs* p = list; p != nullptr; p = p->ifa_next) {
            if (p->ifa_addr == nullptr || p->ifa_addr->sa_family != AF_INET) {
                continue;
            }
            const auto* sa = reinterpret_cast<const sockaddr_in*>(p->ifa_addr);
            out.push_back(AddressRow{ntohl(sa->sin_addr.s_addr), if_nametoindex(p->ifa_name)});
        }
        freeifaddrs(list);
        return true;
    }

    int UdpInDatagrams(uint32_t& count) override {
        std::ifstream in("/proc/thread-self/net/snmp");
        if (!in) {
            return errno != 0 ? errno : ENOENT;
        }
        // Two "Udp:" lines: the field names, then the values.
        std::string names, values, line;
        while (std::getline(in, line)) {
            if (line.rfind("Udp:", 0) == 0) {
                if (names.empty()) {
                    names = line;
                } else {
                    values = line;
                    break;
                }
            }
        }
        std::istringstream n(names), v(values);
        std::string name, value;
        while (n >> name && v >> value) {
            if (name == "InDatagrams") {
                count = static_cast<uint32_t>(std::stoull(value));
                return 0;
            }
        }
        return ENOENT;
    }
};

}  // namespace

NetworkInfo& SystemNetworkInfo() {
    static LinuxNetworkInfo info;
    return info;
}

}  // namespace platform
