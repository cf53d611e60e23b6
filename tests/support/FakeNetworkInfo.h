// Interfaces, addresses and gateways as a test describes them, for the objects it is given to.
#pragma once

#include <string>
#include <vector>

#include "platform/netinfo.h"

namespace testsupport {

class FakeNetworkInfo : public platform::NetworkInfo {
  public:
    FakeNetworkInfo() = default;
    FakeNetworkInfo(const FakeNetworkInfo&) = delete;
    FakeNetworkInfo& operator=(const FakeNetworkInfo&) = delete;

    // One interface whose primary address is `address` and whose default gateway is `gateway`
    // (empty: none).
    void AddInterface(const std::string& address, const std::string& gateway);

    bool Adapters(std::vector<platform::AdapterInfo>& out) override;
    bool AddressTable(std::vector<platform::AddressRow>& out) override;
    int UdpInDatagrams(uint32_t& count) override;

    std::vector<platform::AdapterInfo> adapters;
    bool ok = true;
    uint32_t udpInDatagrams = 42;
    int udpError = 0;
};

}  // namespace testsupport
