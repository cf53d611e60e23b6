#include "platform/netinfo.h"

#include <winsock2.h>

#include <iphlpapi.h>
#include <windows.h>

#include <vector>

namespace platform {

namespace {

// Grows the buffer until the call fits; the table may grow between the two calls.
template <typename Call>
bool QueryTable(std::vector<unsigned char>& buffer, Call call) {
    ULONG size = 16 * 1024;
    for (int attempt = 0; attempt < 4; ++attempt) {
        buffer.assign(size, 0);
        const DWORD rc = call(buffer.data(), &size);
        if (rc == NO_ERROR) {
            return true;
        }
        if (rc != ERROR_BUFFER_OVERFLOW && rc != ERROR_INSUFFICIENT_BUFFER) {
            return false;
        }
    }
    return false;
}

class WindowsNetworkInfo final : public NetworkInfo {
  public:
    bool Adapters(std::vector<AdapterInfo>& out) override {
        out.clear();
        std::vector<unsigned char> buffer;
        if (!QueryTable(buffer, [](unsigned char* data, ULONG* size) {
                return GetAdaptersInfo(reinterpret_cast<IP_ADAPTER_INFO*>(data), size);
            })) {
            return false;
        }
        for (auto* a = reinterpret_cast<const IP_ADAPTER_INFO*>(buffer.data()); a != nullptr;
             a = a->Next) {
            AdapterInfo info;
            info.index = a->Index;
            info.name.assign(a->AdapterName, strnlen(a->AdapterName, sizeof a->AdapterName));
            for (const IP_ADDR_STRING* p = &a->IpAddressList; p != nullptr; p = p->Next) {
                std::string text(p->IpAddress.String,
                                 strnlen(p->IpAddress.String, sizeof p->IpAddress.String));
                if (!text.empty() && text != "0.0.0.0") {
                    info.addresses.push_back(std::move(text));
                }
            }
            std::string gateway(
                a->GatewayList.IpAddress.String,
                strnlen(a->GatewayList.IpAddress.String, sizeof a->GatewayList.IpAddress.String));
            if (gateway != "0.0.0.0") {
                info.gateway = std::move(gateway);
            }
            out.push_back(std::move(info));
        }
        return true;
    }

    bool AddressTable(std::vector<AddressRow>& out) override {
        out.clear();
        std::vector<unsigned char> buffer;
        if (!QueryTable(buffer, [](unsigned char* data, ULONG* size) {
                return GetIpAddrTable(reinterpret_cast<MIB_IPADDRTABLE*>(data), size, FALSE);
            })) {
            return false;
        }
        const auto* table = reinterpret_cast<const MIB_IPADDRTABLE*>(buffer.data());
        const size_t fits =
            (buffer.size() - offsetof(MIB_IPADDRTABLE, table)) / sizeof(MIB_IPADDRROW);
        const size_t rows = table->dwNumEntries < fits ? table->dwNumEntries : fits;
        for (size_t i = 0; i < rows; ++i) {
            out.push_back(AddressRow{ntohl(table->table[i].dwAddr), table->table[i].dwIndex});
        }
        return true;
    }

    int UdpInDatagrams(uint32_t& count) override {
        MIB_UDPSTATS stats{};
        const DWORD rc = GetUdpStatistics(&stats);
        if (rc != NO_ERROR) {
            return static_cast<int>(rc);
        }
        count = stats.dwInDatagrams;
        return 0;
    }
};

class WindowsRouteLookup final : public RouteLookup {
  public:
    int BestInterface(uint32_t destinationNet, uint32_t* interfaceIndex) override {
        DWORD index = 0;
        const DWORD rc = GetBestInterface(destinationNet, &index);
        if (rc != NO_ERROR) {
            return static_cast<int>(rc);
        }
        *interfaceIndex = index;
        return 0;
    }
};

}  // namespace

NetworkInfo& SystemNetworkInfo() {
    static WindowsNetworkInfo info;
    return info;
}

RouteLookup& SystemRouteLookup() {
    static WindowsRouteLookup lookup;
    return lookup;
}

}  // namespace platform
