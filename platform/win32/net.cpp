#include "platform/net.h"

// Winsock 2 before anything that could bring in the old winsock.h.
#include <winsock2.h>

#include <mswsock.h>
#include <windows.h>
#include <ws2tcpip.h>

#include <atomic>
#include <cstring>

#include "platform/kernel.h"
#include "platform/win32/handle.h"

namespace platform {

namespace {

// Windows Sockets for as long as the module is loaded: started when the process attaches it (the
// runtime constructs this before DllMain returns), stopped when it detaches.
struct WinsockSession {
    WinsockSession() {
        WSADATA data{};
        started = WSAStartup(MAKEWORD(2, 2), &data) == 0;
    }
    ~WinsockSession() {
        if (started) {
            WSACleanup();
        }
    }
    bool started = false;
} g_winsock;

thread_local int t_lastError = 0;

// Sockets this layer opened and has not closed yet: what the leak checks count here, since the
// process's handle count also moves with the system's own threads and objects.
std::atomic<int> g_openSockets{0};

int SetError(int e) {
    t_lastError = e;
    return kSocketError;
}

int SetLastSocketError() {
    return SetError(WSAGetLastError());
}

SOCKET Sock(SocketHandle s) {
    return static_cast<SOCKET>(static_cast<intptr_t>(s));
}

SocketHandle HandleOfSocket(SOCKET s) {
    if (s == INVALID_SOCKET) {
        return kInvalidSocket;
    }
    ++g_openSockets;
    return static_cast<SocketHandle>(s);
}

sockaddr_in MakeAddress(uint32_t hostAddress, uint16_t port) {
    sockaddr_in sa{};
    sa.sin_family = AF_INET;
    sa.sin_addr.s_addr = htonl(hostAddress);
    sa.sin_port = htons(port);
    return sa;
}

int ClampLength(size_t length) {
    return length > 0x7FFFFFFF ? 0x7FFFFFFF : static_cast<int>(length);
}

// Waits for network events of the socket together with the calling thread's stop source.
// 1 when one of them happened, 0 on timeout, kSocketError when failed or stopped.
int WaitSocketEvents(SOCKET s, long events, int timeoutMs) {
    WSAEVENT event = WSACreateEvent();
    if (event == WSA_INVALID_EVENT) {
        return SetLastSocketError();
    }
    int result = kSocketError;
    if (WSAEventSelect(s, event, events) != 0) {
        result = SetLastSocketError();
    } else {
        const WaitResult r = WaitReadable(DescriptorOf(event), timeoutMs);
        WSAEventSelect(s, nullptr, 0);
        // WSAEventSelect leaves the socket non-blocking; give it back its blocking mode.
        u_long blocking = 0;
        ioctlsocket(s, FIONBIO, &blocking);
        switch (r) {
            case WaitResult::Signaled:
                result = 1;
                break;
            case WaitResult::Timeout:
                result = 0;
                break;
            case WaitResult::Stopped:
                result = SetError(kErrInterrupted);
                break;
            case WaitResult::Failed:
                result = SetError(static_cast<int>(GetLastError()));
                break;
        }
    }
    WSACloseEvent(event);
    return result;
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

int ResolveHostNameNet(const std::string& name, uint32_t* netAddress) {
    // getaddrinfo answers with the WSA codes themselves (WSAHOST_NOT_FOUND, WSATRY_AGAIN...).
    addrinfo hints{};
    hints.ai_family = AF_INET;
    hints.ai_socktype = SOCK_DGRAM;
    addrinfo* list = nullptr;
    const int rc = getaddrinfo(name.c_str(), nullptr, &hints, &list);
    if (rc != 0) {
        t_lastError = rc;
        return rc;
    }
    int result = kErrNoData;
    for (const addrinfo* p = list; p != nullptr; p = p->ai_next) {
        if (p->ai_family == AF_INET && p->ai_addr != nullptr) {
            sockaddr_in sa{};
            std::memcpy(&sa, p->ai_addr, sizeof sa);
            *netAddress = sa.sin_addr.s_addr;
            result = 0;
            break;
        }
    }
    freeaddrinfo(list);
    t_lastError = result;
    return result;
}

Socket OpenUdpSocket() {
    const SOCKET s = WSASocketW(AF_INET, SOCK_DGRAM, IPPROTO_UDP, nullptr, 0,
                                WSA_FLAG_OVERLAPPED | WSA_FLAG_NO_HANDLE_INHERIT);
    if (s == INVALID_SOCKET) {
        t_lastError = WSAGetLastError();
        return Socket();
    }
    // A port-unreachable answer to an earlier datagram must not fail the next receive:
    // Windows reports it as WSAECONNRESET unless told not to.
    BOOL report = FALSE;
    DWORD returned = 0;
    WSAIoctl(s, SIO_UDP_CONNRESET, &report, sizeof report, nullptr, 0, &returned, nullptr, nullptr);
    return Socket(HandleOfSocket(s));
}

Socket OpenTcpSocket() {
    const SOCKET s = WSASocketW(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0,
                                WSA_FLAG_OVERLAPPED | WSA_FLAG_NO_HANDLE_INHERIT);
    if (s == INVALID_SOCKET) {
        t_lastError = WSAGetLastError();
        return Socket();
    }
    return Socket(HandleOfSocket(s));
}

bool SetReuseAddress(SocketHandle s, bool on) {
    const BOOL value = on ? TRUE : FALSE;
    if (setsockopt(Sock(s), SOL_SOCKET, SO_REUSEADDR, reinterpret_cast<const char*>(&value),
                   sizeof value) != 0) {
        t_lastError = WSAGetLastError();
        return false;
    }
    return true;
}

bool BindSocket(SocketHandle s, uint32_t hostAddress, uint16_t port) {
    const sockaddr_in sa = MakeAddress(hostAddress, port);
    if (bind(Sock(s), reinterpret_cast<const sockaddr*>(&sa), sizeof sa) != 0) {
        t_lastError = WSAGetLastError();
        return false;
    }
    return true;
}

bool GetSocketName(SocketHandle s, uint32_t* hostAddress, uint16_t* port) {
    sockaddr_in sa{};
    int len = sizeof sa;
    if (getsockname(Sock(s), reinterpret_cast<sockaddr*>(&sa), &len) != 0) {
        t_lastError = WSAGetLastError();
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
    if (s != kInvalidSocket && closesocket(Sock(s)) == 0) {
        --g_openSockets;
    }
}

int SendTo(SocketHandle s, const void* data, size_t length, uint32_t hostAddress, uint16_t port) {
    const sockaddr_in sa = MakeAddress(hostAddress, port);
    const int n = sendto(Sock(s), static_cast<const char*>(data), ClampLength(length), 0,
                         reinterpret_cast<const sockaddr*>(&sa), sizeof sa);
    return n == SOCKET_ERROR ? SetLastSocketError() : n;
}

int WaitSocketReadable(SocketHandle s, int timeoutMs) {
    if (s == kInvalidSocket) {
        return SetError(WSAENOTSOCK);
    }
    // Data already queued needs no wait: FD_READ is only signalled for new arrivals once an
    // earlier receive took less than everything.
    fd_set readable;
    FD_ZERO(&readable);
    FD_SET(Sock(s), &readable);
    timeval now{0, 0};
    const int ready = select(0, &readable, nullptr, nullptr, &now);
    if (ready == SOCKET_ERROR) {
        return SetLastSocketError();
    }
    if (ready > 0) {
        return 1;
    }
    return WaitSocketEvents(Sock(s), FD_READ | FD_ACCEPT | FD_CLOSE, timeoutMs);
}

int ReceiveFrom(SocketHandle s, void* buffer, size_t capacity, uint32_t* fromHostAddress,
                uint16_t* fromPort) {
    sockaddr_in sa{};
    int len = sizeof sa;
    const int n = recvfrom(Sock(s), static_cast<char*>(buffer), ClampLength(capacity), 0,
                           reinterpret_cast<sockaddr*>(&sa), &len);
    if (n == SOCKET_ERROR) {
        return SetLastSocketError();  // WSAEMSGSIZE for a cut datagram, as the callers expect
    }
    if (fromHostAddress != nullptr) {
        *fromHostAddress = ntohl(sa.sin_addr.s_addr);
    }
    if (fromPort != nullptr) {
        *fromPort = ntohs(sa.sin_port);
    }
    return n;
}

int ConnectSocket(SocketHandle s, uint32_t hostAddress, uint16_t port, int timeoutMs) {
    const sockaddr_in sa = MakeAddress(hostAddress, port);
    u_long nonBlocking = 1;
    if (ioctlsocket(Sock(s), FIONBIO, &nonBlocking) != 0) {
        return SetLastSocketError();
    }
    int result = 0;
    if (connect(Sock(s), reinterpret_cast<const sockaddr*>(&sa), sizeof sa) != 0) {
        if (WSAGetLastError() != WSAEWOULDBLOCK) {
            result = SetLastSocketError();
        } else {
            const int r = WaitSocketEvents(Sock(s), FD_CONNECT, timeoutMs);
            if (r == 0) {
                result = SetError(kErrTimedOut);
            } else if (r < 0) {
                result = r;
            } else {
                int error = 0;
                int len = sizeof error;
                if (getsockopt(Sock(s), SOL_SOCKET, SO_ERROR, reinterpret_cast<char*>(&error),
                               &len) != 0) {
                    error = WSAGetLastError();
                }
                result = error != 0 ? SetError(error) : 0;
            }
        }
    }
    u_long blocking = 0;
    ioctlsocket(Sock(s), FIONBIO, &blocking);
    return result;
}

int Send(SocketHandle s, const void* data, size_t length) {
    const int n = send(Sock(s), static_cast<const char*>(data), ClampLength(length), 0);
    return n == SOCKET_ERROR ? SetLastSocketError() : n;
}

int Receive(SocketHandle s, void* buffer, size_t capacity) {
    const int n = recv(Sock(s), static_cast<char*>(buffer), ClampLength(capacity), 0);
    return n == SOCKET_ERROR ? SetLastSocketError() : n;
}

int CountOpenDescriptors() {
    return g_openSockets.load();
}

}  // namespace platform
