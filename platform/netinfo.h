// What the system knows about the host's IPv4 interfaces: the address table, adapters with their
// gateways, and the UDP receive counter.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace platform {

struct AdapterInfo {
    uint32_t index = 0;                  // interface index
    std::string name;                    // interface name
    std::vector<std::string> addresses;  // IPv4 addresses as dotted text, primary first
    std::string gateway;                 // gateway of a default route through it, or empty
};

struct AddressRow {
    uint32_t hostAddress = 0;  // host order
    uint32_t interfaceIndex = 0;
};

// The source of these answers. Objects that read them take one; tests pass a double.
class NetworkInfo {
  public:
    virtual ~NetworkInfo() = default;
    // Adapters in the system's order; false when the query failed.
    virtual bool Adapters(std::vector<AdapterInfo>& out) = 0;
    // Every IPv4 address of every interface, in the system's order; false on failure.
    virtual bool AddressTable(std::vector<AddressRow>& out) = 0;
    // Datagrams received by the host; 0 or an error code.
    virtual int UdpInDatagrams(uint32_t& count) = 0;
};

// The system's answers; the default wherever a NetworkInfo is taken.
NetworkInfo& SystemNetworkInfo();

// The interface the system would send through toward a destination (GetBestInterface). Asking
// sends nothing.
class RouteLookup {
  public:
    virtual ~RouteLookup() = default;
    // 0 and the interface index, or the system's error (no route, say).
    virtual int BestInterface(uint32_t destinationNet, uint32_t* interfaceIndex) = 0;
};

// The kernel's route look-up.
RouteLookup& SystemRouteLookup();

}  // namespace platform
