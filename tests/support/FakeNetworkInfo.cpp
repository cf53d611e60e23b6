#include "tests/support/FakeNetworkInfo.h"

#include "platform/net.h"

namespace testsupport {

void FakeNetworkInfo::AddInterface(const std::string& address, const std::string& gateway) {
    platform::AdapterInfo a;
    a.index = static_cast<uint32_t>(adapters.size() + 1);
    a.name = "fake" + std::to_string(a.index);
    a.addresses = {address};
    a.gateway = gateway;
    adapters.push_back(a);
}

bool FakeNetworkInfo::Adapters(std::vector<platform::AdapterInfo>& out) {
    out = adapters;
    return ok;
}

bool FakeNetworkInfo::AddressTable(std::vector<platform::AddressRow>& out) {
    out.clear();
    for (const auto& a : adapters) {
        for (const auto& address : a.addresses) {
            out.push_back({platform::NetToHost32(platform::InetAddrNet(address)), a.index});
        }
    }
    return ok;
}

int FakeNetworkInfo::UdpInDatagrams(uint32_t& count) {
    count = udpInDatagrams;
    return udpError;
}

}  // namespace testsupport
