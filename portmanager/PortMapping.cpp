#include "portmanager/PortMapping.h"

#include <cstdint>
#include <optional>
#include <utility>

#include "foundation/Logger.h"
#include "platform/net.h"
#include "portmanager/PortMappingPool.h"

namespace portmanager {

namespace {

// A dotted quad to a host-order address. Anything else gives INADDR_NONE, which is refused
// outright: Windows cannot bind it, but Linux would bind the broadcast address.
std::optional<uint32_t> DottedToHost(const std::string& address) {
    const uint32_t net = platform::InetAddrNet(address);
    if (net == platform::kInaddrNone) {
        return std::nullopt;
    }
    return platform::NetToHost32(net);
}

}  // namespace

bool MappedServiceEndpoint::Open(bool anyPort) {
    const std::optional<uint32_t> address = DottedToHost(m_private.m_address);
    // A port outside 16 bits would otherwise wrap and reserve some unrelated port.
    const bool portFits = anyPort || (m_private.m_port >= 0 && m_private.m_port <= 0xFFFF);
    const uint16_t port = anyPort ? 0 : static_cast<uint16_t>(m_private.m_port);

    // A record's handle is a copy, never owned here: a failed open leaves it without one.
    m_socket = platform::kInvalidSocket;
    if (!address || !portFits) {
        return false;
    }
    platform::Socket placeholder = platform::OpenUdpSocket();
    // No SO_REUSEADDR: the placeholder must fail on a port anyone else holds.
    uint16_t bound = 0;
    if (!placeholder || !platform::BindSocket(placeholder.Get(), *address, port) ||
        !platform::GetSocketName(placeholder.Get(), nullptr, &bound)) {
        return false;
    }
    // From here the record carries the descriptor; the pool that holds the record closes it.
    m_socket = placeholder.Release();
    m_private.m_port = bound;
    m_public.m_port = bound;
    return true;
}

void MappedServiceEndpoint::Close() {
    platform::CloseSocket(std::exchange(m_socket, platform::kInvalidSocket));
}

std::string MappedServiceEndpoint::ToString() const {
    return "m_private = (" + m_private.ToString() + "), m_public=(" + m_public.ToString() + ")";
}

std::string PortMapping::ToString() const {
    return "m_local=(" + m_local.ToString() + "), m_remote=(" + m_remote.ToString() + ")";
}

void PortMapping::Refresh() const {
    constexpr const char* kFunction = "PortMapping::Refresh";
    // The 16-bit view of the ports is what goes on the wire, so 65536 counts as 0. Checked
    // before the remote is resolved: a skipped mapping costs no name look-up.
    const uint16_t localPort = static_cast<uint16_t>(m_local.m_private.m_port);
    const uint16_t remotePort = static_cast<uint16_t>(m_remote.m_port);
    if (localPort == 0 || remotePort == 0) {
        return;
    }
    const std::optional<uint32_t> localAddress = DottedToHost(m_local.m_private.m_address);
    if (!localAddress) {
        return;
    }
    const uint32_t remoteAddress =
        platform::NetToHost32(foundation::GetIPByName(m_remote.m_address, 0));

    // Failures before the send stay silent: the next tick simply tries again.
    const platform::Socket socket = platform::OpenUdpSocket();
    if (!socket) {
        return;
    }
    // Shares the port with the client's own socket there (which must allow reuse too).
    if (!platform::SetReuseAddress(socket.Get(), true)) {
        return;
    }
    if (!platform::BindSocket(socket.Get(), *localAddress, localPort)) {
        return;
    }
    if (platform::SendTo(socket.Get(), kKeepAlive, sizeof kKeepAlive, remoteAddress, remotePort) ==
        platform::kSocketError) {
        const int error = platform::LastSocketError();
        NQ_LOG(kFunction, foundation::kLogError, "Failed(%d) - %s", error, ToString().c_str());
        return;
    }
    NQ_LOG(kFunction, foundation::kLogDebug, "Succeeded - %s", ToString().c_str());
}

void RefreshPortMappings(const std::vector<PortMapping>& mappings) {
    NQ_TRACE_ENTERED("CAdvancedPortManager::RefreshPortMappings");
    for (const PortMapping& mapping : mappings) {
        mapping.Refresh();
    }
}

void DumpPortMappings(const char* typeName, const PortMappingPool& pool) {
    std::string dump;
    for (const MappedServiceEndpoint& mapping : pool.Free()) {
        dump += mapping.ToString();
        dump += '\n';
    }
    NQ_LOG("DumpPortMappings", foundation::kLogInfo, "type=%s\n%s\n", typeName, dump.c_str());
}

}  // namespace portmanager
