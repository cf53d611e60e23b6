#include "platform/netchange.h"

#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstring>

namespace platform {

namespace {
// Address and route notifications are a few hundred bytes each; one datagram carries few.
constexpr size_t kReceiveBufferSize = 16384;
}  // namespace

NetworkChanges ParseNetworkChanges(const void* data, size_t length) {
    NetworkChanges changes;
    const auto* bytes = static_cast<const uint8_t*>(data);
    size_t offset = 0;
    while (data != nullptr && length - offset >= sizeof(nlmsghdr)) {
        // Copied out, so an unaligned buffer is no problem.
        nlmsghdr header{};
        std::memcpy(&header, bytes + offset, sizeof header);
        if (header.nlmsg_len < sizeof header || header.nlmsg_len > length - offset) {
            break;
        }
        switch (header.nlmsg_type) {
            case RTM_NEWADDR:
            case RTM_DELADDR:
                changes.addresses = true;
                break;
            case RTM_NEWROUTE:
            case RTM_DELROUTE:
                changes.routes = true;
                break;
            default:
                break;
        }
        const size_t advance = NLMSG_ALIGN(header.nlmsg_len);
        if (advance >= length - offset) {
            break;
        }
        offset += advance;
    }
    return changes;
}

NetworkChangeWatcher::NetworkChangeWatcher()
    : socket_(socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC | SOCK_NONBLOCK, NETLINK_ROUTE)) {
    if (!socket_) {
        return;
    }
    sockaddr_nl local{};
    local.nl_family = AF_NETLINK;
    local.nl_groups = RTMGRP_IPV4_IFADDR | RTMGRP_IPV4_ROUTE;
    if (bind(socket_.Get(), reinterpret_cast<const sockaddr*>(&local), sizeof local) != 0) {
        socket_.Close();
    }
}

NetworkChanges NetworkChangeWatcher::Read() {
    NetworkChanges changes;
    if (!socket_) {
        return changes;
    }
    uint8_t buffer[kReceiveBufferSize];
    for (;;) {
        sockaddr_nl sender{};
        iovec io{buffer, sizeof buffer};
        msghdr message{};
        message.msg_name = &sender;
        message.msg_namelen = sizeof sender;
        message.msg_iov = &io;
        message.msg_iovlen = 1;
        const ssize_t n = recvmsg(socket_.Get(), &message, 0);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            if (errno == ENOBUFS) {
                // Notifications were dropped: either kind may be among them.
                changes.addresses = changes.routes = true;
                continue;
            }
            changes.failed = errno != EAGAIN && errno != EWOULDBLOCK;
            return changes;
        }
        // Only the kernel may speak on these groups.
        if (sender.nl_pid != 0) {
            continue;
        }
        // A cut datagram may hide either kind.
        if ((message.msg_flags & MSG_TRUNC) != 0) {
            changes.addresses = changes.routes = true;
            continue;
        }
        const NetworkChanges found = ParseNetworkChanges(buffer, static_cast<size_t>(n));
        changes.addresses = changes.addresses || found.addresses;
        changes.routes = changes.routes || found.routes;
    }
}

}  // namespace platform
