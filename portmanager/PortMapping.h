// The records that carry a private endpoint and its public counterpart through the port
// manager, the placeholder socket that reserves a port, and the keep-alive that keeps a NAT
// binding open.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "foundation/NetUtils.h"
#include "foundation/NetworkEndpoint.h"

namespace portmanager {

using foundation::NetworkEndpoint;

// The keep-alive payload: no STUN or SIP message, just enough to cross the NAT.
inline constexpr unsigned char kKeepAlive[4] = {0x00, 0x01, 0x02, 0x03};

struct MappedServiceEndpoint {
    NetworkEndpoint m_private;
    NetworkEndpoint m_public;
    // Holds the port while the mapping is in reserve. Copies share the handle without owning
    // it: whoever closes it does so explicitly and resets its own copy.
    foundation::SocketHandle m_socket = foundation::kInvalidSocket;

    MappedServiceEndpoint() = default;
    MappedServiceEndpoint(NetworkEndpoint privateEndpoint, NetworkEndpoint publicEndpoint)
        : m_private(std::move(privateEndpoint)), m_public(std::move(publicEndpoint)) {}

    // Binds a placeholder socket to m_private (any port when anyPort) with no options, so a port
    // that anyone else holds cannot be taken; both ports then become the bound one.
    bool Open(bool anyPort);
    // Closes the placeholder socket, if any.
    void Close();
    std::string ToString() const;
};

struct PortMapping {
    MappedServiceEndpoint m_local;
    NetworkEndpoint m_remote;

    PortMapping() = default;
    PortMapping(MappedServiceEndpoint local, NetworkEndpoint remote)
        : m_local(std::move(local)), m_remote(std::move(remote)) {}

    // Sends one keep-alive from m_local.m_private to m_remote on a short-lived socket that
    // shares the port (SO_REUSEADDR). Only the send is logged.
    void Refresh() const;
    std::string ToString() const;
};

void RefreshPortMappings(const std::vector<PortMapping>& mappings);

class PortMappingPool;
// One log entry with the free mappings of the pool.
void DumpPortMappings(const char* typeName, const PortMappingPool& pool);

}  // namespace portmanager
