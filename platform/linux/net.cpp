#include "platform/net.h"

#include <arpa/inet.h>
#include <dirent.h>
#include <fcntl.h>
#include <netdb.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <new>
#include <optional>

#include "platform/kernel.h"
#include "platform/modulelock.h"

namespace platform {

namespace {
thread_local int t_lastError = 0;

int SetError(int e) {
    t_lastError = e;
    return kSocketError;
}

sockaddr_in MakeAddress(uint32_t hostAddress, uint16_t port) {
    sockaddr_in sa{};
    sa.sin_family = AF_INET;
    sa.sin_addr.s_addr = htonl(hostAddress);
    sa.sin_port = htons(port);
    return sa;
}
}  // namespace

int LastSocketError() {
    return t_lastError;
}

uint32_t HostToNet32(uint32_t v) {
    return htonl(v);
}
uint32_t NetToHost32(uint32_t v) {
    return ntohl(v);
}
uint16_t HostToNet16(uint16_t v) {
    return htons(v);
}
uint16_t NetToHost16(uint16_t v) {
    return ntohs(v);
}

uint32_t InetAddrNet(const std::string& text) {
    return inet_addr(text.c_str());
}

std::string InetNtoaNet(uint32_t netAddress) {
    in_addr a{};
    a.s_addr = netAddress;
    char buf[INET_ADDRSTRLEN] = {};
    inet_ntop(AF_INET, &a, buf, sizeof buf);
    return buf;
}

namespace {

int ResolverError(int rc) {
    switch (rc) {
        case EAI_NONAME:
#ifdef EAI_NODATA
        case EAI_NODATA:
#endif
        case EAI_FAMILY:
            return kErrHostNotFound;
        case EAI_AGAIN:
            return kErrTryAgain;
        default:
            return kErrNoRecovery;
    }
}

int FirstIPv4(const addrinfo* list, uint32_t* netAddress) {
    for (const addrinfo* p = list; p != nullptr; p = p->ai_next) {
        if (p->ai_family == AF_INET && p->ai_addr != nullptr) {
            sockaddr_in sa{};
            std::memcpy(&sa, p->ai_addr, sizeof sa);
            *netAddress = sa.sin_addr.s_addr;
            return 0;
        }
    }
    return kErrNoData;
}

#if defined(__SANITIZE_THREAD__)
constexpr bool kThreadSanitizer = true;
#else
constexpr bool kThreadSanitizer = false;
#endif

addrinfo LookupHints() {
    addrinfo hints{};
    hints.ai_family = AF_INET;
    hints.ai_socktype = SOCK_DGRAM;
    return hints;
}

// A look-up in the resolver's own thread, so that a thread with an owner can stop waiting for
// it. Whoever of the waiter and the resolver's notification lets go last frees it.
struct AsyncLookup {
    std::string name;
    addrinfo hints = LookupHints();
    gaicb request{};
    int doneFd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    std::atomic<int> holders{2};
    // The notification runs our code in the resolver's thread, also after a stopped waiter has
    // gone: until then the module must not unload.
    ModuleReference moduleLock;

    void Drop() {
        if (--holders == 0) {
            if (request.ar_result != nullptr) {
                freeaddrinfo(request.ar_result);
            }
            close(doneFd);
            delete this;
        }
    }
};

void LookupDone(sigval value) {
    auto* lookup = static_cast<AsyncLookup*>(value.sival_ptr);
    uint64_t one = 1;
    [[maybe_unused]] ssize_t n = write(lookup->doneFd, &one, sizeof one);
    lookup->Drop();
}

// Empty when the look-up could not be started that way.
std::optional<int> ResolveInterruptibly(const std::string& name, uint32_t* netAddress) {
    auto* lookup = new (std::nothrow) AsyncLookup;
    if (lookup == nullptr) {
        return std::nullopt;
    }
    if (lookup->doneFd < 0) {
        delete lookup;
        return std::nullopt;
    }
    lookup->name = name;
    lookup->request.ar_name = lookup->name.c_str();
    lookup->request.ar_request = &lookup->hints;
    gaicb* list[] = {&lookup->request};
    sigevent done{};
    done.sigev_notify = SIGEV_THREAD;
    done.sigev_notify_function = LookupDone;
    done.sigev_value.sival_ptr = lookup;
    if (getaddrinfo_a(GAI_NOWAIT, list, 1, &done) != 0) {
        close(lookup->doneFd);
        delete lookup;
        return std::nullopt;
    }
    int result = 0;
    switch (WaitReadable(lookup->doneFd, -1)) {
        case WaitResult::Signaled: {
            const int rc = gai_error(&lookup->request);
            result = rc != 0 ? ResolverError(rc) : FirstIPv4(lookup->request.ar_result, netAddress);
            break;
        }
        case WaitResult::Stopped:
            // A request still queued is taken back and never notified: its hold goes here.
            // One already running ends in the resolver, which then lets go.
            if (gai_cancel(&lookup->request) == EAI_CANCELED) {
                lookup->Drop();
            }
            result = kErrInterrupted;
            break;
        default:
            result = kErrNoRecovery;
            break;
    }
    lookup->Drop();
    return result;
}

}  // namespace

int ResolveHostNameNet(const std::string& name, uint32_t* netAddress) {
    // Threads with an owner must be able to stop while the resolver waits for a name server.
    // ThreadSanitizer cannot follow the resolver's own threads (glibc starts them outside its
    // interceptors and they crash in its allocator), so its builds wait for the answer.
    if (CurrentStopSource() != nullptr && !kThreadSanitizer) {
        if (const auto result = ResolveInterruptibly(name, netAddress)) {
            t_lastError = *result;
            return *result;
        }
    }
    const addrinfo hints = LookupHints();
    addrinfo* list = nullptr;
    const int rc = getaddrinfo(name.c_str(), nullptr, &hints, &list);
    if (rc != 0) {
        t_lastError = ResolverError(rc);
        return t_lastError;
    }
    const int result = FirstIPv4(list, netAddress);
    freeaddrinfo(list);
    t_lastError = result;
    return result;
}

Socket OpenUdpSocket() {
    const int s = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, IPPROTO_UDP);
    if (s < 0) {
        t_lastError = errno;
    }
    return Socket(s < 0 ? kInvalidSocket : s);
}

Socket OpenTcpSocket() {
    const int s = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, IPPROTO_TCP);
    if (s < 0) {
        t_lastError = errno;
    }
    return Socket(s < 0 ? kInvalidSocket : s);
}

bool SetReuseAddress(SocketHandle s, bool on) {
    const int value = on ? 1 : 0;
    if (setsockopt(s, SOL_SOCKET, SO_REUSEADDR, &value, sizeof value) != 0) {
        t_lastError = errno;
        return false;
    }
    return true;
}

bool BindSocket(SocketHandle s, uint32_t hostAddress, uint16_t port) {
    const sockaddr_in sa = MakeAddress(hostAddress, port);
    if (bind(s, reinterpret_cast<const sockaddr*>(&sa), sizeof sa) != 0) {
        t_lastError = errno;
        return false;
    }
    return true;
}

bool GetSocketName(SocketHandle s, uint32_t* hostAddress, uint16_t* port) {
    sockaddr_in sa{};
    socklen_t len = sizeof sa;
    if (getsockname(s, reinterpret_cast<sockaddr*>(&sa), &len) != 0) {
        t_lastError = errno;
        return false;
    }
    if (hostAddress != nullptr) {
        *hostAddress = ntohl(sa.sin_addr.s_addr);
    }
    if (port != nullptr) {
        *port = ntohs(sa.sin_port);
    }
    return true;
}

void CloseSocket(SocketHandle s) {
    if (s != kInvalidSocket) {
        close(s);
    }
}

int SendTo(SocketHandle s, const void* data, size_t length, uint32_t hostAddress, uint16_t port) {
    const sockaddr_in sa = MakeAddress(hostAddress, port);
    const ssize_t n =
        sendto(s, data, length, MSG_NOSIGNAL, reinterpret_cast<const sockaddr*>(&sa), sizeof sa);
    if (n < 0) {
        return SetError(errno);
    }
    return static_cast<int>(n);
}

int WaitSocketReadable(SocketHandle s, int timeoutMs) {
    if (s == kInvalidSocket) {
        return SetError(EBADF);
    }
    switch (WaitReadable(s, timeoutMs)) {
        case WaitResult::Signaled:
            return 1;
        case WaitResult::Timeout:
            return 0;
        case WaitResult::Stopped:
            return SetError(kErrInterrupted);
        case WaitResult::Failed:
            break;
    }
    return SetError(errno);
}

int ReceiveFrom(SocketHandle s, void* buffer, size_t capacity, uint32_t* fromHostAddress,
                uint16_t* fromPort) {
    sockaddr_in sa{};
    socklen_t len = sizeof sa;
    // MSG_TRUNC makes the kernel report the real size, so a cut datagram can be refused.
    const ssize_t n =
        recvfrom(s, buffer, capacity, MSG_TRUNC, reinterpret_cast<sockaddr*>(&sa), &len);
    if (n < 0) {
        return SetError(errno);
    }
    if (static_cast<size_t>(n) > capacity) {
        return SetError(kErrMessageSize);
    }
    if (fromHostAddress != nullptr) {
        *fromHostAddress = ntohl(sa.sin_addr.s_addr);
    }
    if (fromPort != nullptr) {
        *fromPort = ntohs(sa.sin_port);
    }
    return static_cast<int>(n);
}

int ConnectSocket(SocketHandle s, uint32_t hostAddress, uint16_t port, int timeoutMs) {
    const sockaddr_in sa = MakeAddress(hostAddress, port);
    const int flags = fcntl(s, F_GETFL);
    if (flags < 0 || fcntl(s, F_SETFL, flags | O_NONBLOCK) != 0) {
        return SetError(errno);
    }
    int result = 0;
    if (connect(s, reinterpret_cast<const sockaddr*>(&sa), sizeof sa) != 0) {
        if (errno != EINPROGRESS) {
            result = SetError(errno);
        } else {
            // Writable once the handshake ended either way; the stop source wakes us too.
            const StopSource* stop = CurrentStopSource();
            pollfd fds[2] = {{s, POLLOUT, 0},
                             {stop != nullptr ? stop->Descriptor() : -1, POLLIN, 0}};
            const uint64_t deadline =
                GetTickCount64() + static_cast<uint64_t>(timeoutMs < 0 ? 0 : timeoutMs);
            for (;;) {
                int wait = -1;
                if (timeoutMs >= 0) {
                    const uint64_t now = GetTickCount64();
                    wait = now >= deadline ? 0 : static_cast<int>(deadline - now);
                }
                const int r = poll(fds, 2, wait);
                if (r < 0 && errno == EINTR) {
                    continue;
                }
                if (r < 0) {
                    result = SetError(errno);
                } else if (r == 0) {
                    result = SetError(kErrTimedOut);
                } else if ((fds[1].revents & POLLIN) != 0) {
                    result = SetError(kErrInterrupted);
                } else {
                    int error = 0;
                    socklen_t len = sizeof error;
                    if (getsockopt(s, SOL_SOCKET, SO_ERROR, &error, &len) != 0) {
                        error = errno;
                    }
                    result = error != 0 ? SetError(error) : 0;
                }
                break;
            }
        }
    }
    fcntl(s, F_SETFL, flags);
    return result;
}

int Send(SocketHandle s, const void* data, size_t length) {
    const ssize_t n = send(s, data, length, MSG_NOSIGNAL);
    if (n < 0) {
        return SetError(errno);
    }
    return static_cast<int>(n);
}

int Receive(SocketHandle s, void* buffer, size_t capacity) {
    iovec part{buffer, capacity};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    const ssize_t n = recvmsg(s, &message, 0);
    if (n < 0) {
        return SetError(errno);
    }
    // Only datagram sockets set it: the rest of that datagram is gone.
    if ((message.msg_flags & MSG_TRUNC) != 0) {
        return SetError(kErrMessageSize);
    }
    return static_cast<int>(n);
}

int CountOpenDescriptors() {
    DIR* dir = opendir("/proc/self/fd");
    if (dir == nullptr) {
        return -1;
    }
    int count = 0;
    while (dirent* e = readdir(dir)) {
        if (e->d_name[0] != '.') {
            ++count;
        }
    }
    closedir(dir);
    return count - 1;  // the directory stream itself
}

}  // namespace platform
