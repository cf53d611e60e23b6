#include "portmanager/PortMapping.h"

#include <cstdint>
#include <optional>

#include "foundation/Logger.h"
#include "platform/net.h"
#include "portmanager/PortMappingPool.h"

namespace portmanager {

namespace {

// Closes the short-lived keep-alive socket on every path out of Refresh.
class ScopedSocket {
  public:
    ScopedSocket() : m_handle(platform::OpenUdpSocket()) {}
    ~ScopedSocket() { platform::CloseSocket(m_handle); }
    ScopedSocket(const ScopedSocket&) = delete;
    ScopedSocket& operator=(const ScopedSocket&) = delete;

    bool IsValid() const { return m_handle != platform::kInvalidSocket; }
    platform::SocketHandle Get() const { return m_handle; }

  private:
    platform::SocketHandle m_handle;
};

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

    m_socket = address && portFits ? platform::OpenUdpSocket() : platform::kInvalidSocket;
    if (m_socket == platform::kInvalidSocket) {
        return false;
    }
    // No SO_REUSEADDR: the placeholder must fail on a port anyone else holds.
    uint16_t bound = 0;
    if (!platform::BindSocket(m_socket, *address, port) ||
        !platform::GetSocketName(m_socket, nullptr, &bound)) {
        Close();
        return false;
    }
    m_private.m_port = bound;
    m_public.m_port = bound;
    return true;
}

void MappedServiceEndpoint::Close() {
    if (m_socket != platform::kInvalidSocket) {
        platform::CloseSocket(m_socket);
        m_socket = platform::kInvalidSocket;
    }
}

std::string MappedServiceEndpoint::ToString() const {
    return "m_private = (" + m_private.ToString() + "), m_public=(" + m_public.ToString() + ")";
}

std::string PortMapping::ToString() const {
    return "m_local=(" + m_local.ToString() + "), m_remote=(" + m_remote.ToString() + ")";
}

void PortMapping::Refresh() const {
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
    ScopedSocket socket;
    if (!socket.IsValid()) {
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
        NQ_LOG("PortMapping::Refresh", foundation::kLogError, "Failed(%d) - %s", error,
               ToString().c_str());
        return;
    }
    NQ_LOG("PortMapping::Refresh", foundation::kLogDebug, "Succeeded - %s", ToString().c_str());
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
