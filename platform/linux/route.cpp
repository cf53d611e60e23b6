// GetBestInterface on Linux: one RTM_GETROUTE question to the kernel, which answers with the
// route it would use, output interface included. Nothing is sent toward the destination.
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/kernel.h"
#include "platform/net.h"
#include "platform/netinfo.h"

namespace platform {

namespace {

constexpr int kAnswerWaitMs = 1000;

// The output interface of an RTM_NEWROUTE answer, or the kernel's error, or EBADMSG.
int ParseRouteAnswer(const uint8_t* data, size_t length, uint32_t* interfaceIndex) {
    size_t at = 0;
    while (length - at >= sizeof(nlmsghdr)) {
        nlmsghdr header;
        std::memcpy(&header, data + at, sizeof header);
        if (header.nlmsg_len < sizeof header || header.nlmsg_len > length - at) {
            return EBADMSG;
        }
        const uint8_t* body = data + at + NLMSG_HDRLEN;
        const size_t bodyLength = header.nlmsg_len - NLMSG_HDRLEN;
        if (header.nlmsg_type == NLMSG_ERROR) {
            nlmsgerr error;
            if (bodyLength < sizeof error) {
                return EBADMSG;
            }
            std::memcpy(&error, body, sizeof error);
            return error.error != 0 ? -error.error : EBADMSG;
        }
        if (header.nlmsg_type == RTM_NEWROUTE && bodyLength >= NLMSG_ALIGN(sizeof(rtmsg))) {
            size_t attrAt = NLMSG_ALIGN(sizeof(rtmsg));
            while (bodyLength - attrAt >= sizeof(rtattr)) {
                rtattr attr;
                std::memcpy(&attr, body + attrAt, sizeof attr);
                if (attr.rta_len < sizeof attr || attr.rta_len > bodyLength - attrAt) {
                    return EBADMSG;
                }
                if (attr.rta_type == RTA_OIF && attr.rta_len >= RTA_LENGTH(sizeof(uint32_t))) {
                    std::memcpy(interfaceIndex, body + attrAt + RTA_LENGTH(0), sizeof(uint32_t));
                    return 0;
                }
                attrAt += RTA_ALIGN(attr.rta_len);
            }
            return ENETUNREACH;
        }
        at += NLMSG_ALIGN(header.nlmsg_len);
        if (at > length) {
            break;
        }
    }
    return EBADMSG;
}

class KernelRouteLookup final : public RouteLookup {
  public:
    int BestInterface(uint32_t destinationNet, uint32_t* interfaceIndex) override {
        Socket s(socket(AF_NETLINK, SOCK_DGRAM | SOCK_CLOEXEC, NETLINK_ROUTE));
        if (!s.IsValid()) {
            return errno;
        }
        struct {
            nlmsghdr header;
            rtmsg route;
            rtattr attr;
            uint32_t destination;
        } request{};
        request.header.nlmsg_len = sizeof request;
        request.header.nlmsg_type = RTM_GETROUTE;
        request.header.nlmsg_flags = NLM_F_REQUEST;
        request.header.nlmsg_seq = 1;
        request.route.rtm_family = AF_INET;
        request.route.rtm_dst_len = 32;
        request.attr.rta_type = RTA_DST;
        request.attr.rta_len = RTA_LENGTH(sizeof(uint32_t));
        request.destination = destinationNet;
        if (send(s.Get(), &request, sizeof request, 0) != static_cast<ssize_t>(sizeof request)) {
            return errno;
        }
        if (WaitReadable(s.Get(), kAnswerWaitMs) != WaitResult::Signaled) {
            return ETIMEDOUT;
        }
        uint8_t answer[4096];
        const ssize_t n = recv(s.Get(), answer, sizeof answer, 0);
        if (n < 0) {
            return errno;
        }
        return ParseRouteAnswer(answer, static_cast<size_t>(n), interfaceIndex);
    }
};

}  // namespace

RouteLookup& SystemRouteLookup() {
    static KernelRouteLookup lookup;
    return lookup;
}

}  // namespace platform
