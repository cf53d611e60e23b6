// Thin IPv4 socket layer. Its types and results mirror the BSD/Winsock ones so that the logic
// above reads the same on every platform: a socket handle with an invalid value, byte counts or
// kSocketError from send and receive, and the last socket error of the calling thread.
// Addresses are taken and given in host order (192.168.0.1 is 0xC0A80001) unless a name says
// "Net", which means network order as the resolver and inet_addr give it.
#pragma once

#include "platform/system_names.h"

#include <cstddef>
#include <cstdint>
#include <string>

namespace platform {

// The raw descriptor, as the calls below take it and as records that only carry a socket hold it.
using SocketHandle = int;
inline constexpr SocketHandle kInvalidSocket = -1;
inline constexpr int kSocketError = -1;

// Closes a raw descriptor; kInvalidSocket is ignored. Owners that hold a Socket never call it.
void CloseSocket(SocketHandle s);

// Owns one socket descriptor: move-only, closed on destruction. Release() hands the descriptor
// off to a record whose owner closes it explicitly.
class Socket {
  public:
    Socket() noexcept = default;
    explicit Socket(SocketHandle handle) noexcept : handle_(handle) {}
    ~Socket() { Close(); }
    Socket(Socket&& other) noexcept : handle_(other.Release()) {}
    Socket& operator=(Socket&& other) noexcept {
        if (this != &other) {
            Reset(other.Release());
        }
        return *this;
    }
    Socket(const Socket&) = delete;
    Socket& operator=(const Socket&) = delete;

    SocketHandle Get() const noexcept { return handle_; }
    bool IsValid() const noexcept { return handle_ != kInvalidSocket; }
    explicit operator bool() const noexcept { return IsValid(); }
    [[nodiscard]] SocketHandle Release() noexcept {
        const SocketHandle h = handle_;
        handle_ = kInvalidSocket;
        return h;
    }
    void Reset(SocketHandle handle = kInvalidSocket) noexcept {
        CloseSocket(handle_);
        handle_ = handle;
    }
    void Close() noexcept { Reset(); }

  private:
    SocketHandle handle_ = kInvalidSocket;
};

// Socket error values, named as in Winsock.
inline constexpr int kErrHostNotFound = 11001;  // WSAHOST_NOT_FOUND
inline constexpr int kErrTryAgain = 11002;      // WSATRY_AGAIN
inline constexpr int kErrNoRecovery = 11003;    // WSANO_RECOVERY
inline constexpr int kErrNoData = 11004;        // WSANO_DATA
inline constexpr int kErrMessageSize = 10040;   // WSAEMSGSIZE: datagram longer than the buffer
inline constexpr int kErrInterrupted = 10004;   // WSAEINTR: the owner asked the thread to stop
inline constexpr int kErrTimedOut = 10060;      // WSAETIMEDOUT: a connect did not finish in time

int LastSocketError();

uint32_t HostToNet32(uint32_t v);
uint32_t NetToHost32(uint32_t v);
uint16_t HostToNet16(uint16_t v);
uint16_t NetToHost16(uint16_t v);

inline constexpr uint32_t kInaddrNone = 0xFFFFFFFFu;
// inet_addr: dotted text to a network-order address, kInaddrNone when it is not an address.
uint32_t InetAddrNet(const std::string& text);
// inet_ntoa of a network-order address.
std::string InetNtoaNet(uint32_t netAddress);

// Resolves a host name (no dotted-quad shortcut) to its first IPv4 address, network order.
// Returns 0 on success, otherwise a socket error (kErrHostNotFound when the name is unknown).
// Safe when several threads resolve at once. On a thread started by platform::Thread the wait
// ends early with kErrInterrupted when its owner asks it to stop.
int ResolveHostNameNet(const std::string& name, uint32_t* netAddress);

// An IPv4 datagram socket; invalid on failure.
Socket OpenUdpSocket();
// An IPv4 stream socket; invalid on failure.
Socket OpenTcpSocket();
bool SetReuseAddress(SocketHandle s, bool on);
bool BindSocket(SocketHandle s, uint32_t hostAddress, uint16_t port);
bool GetSocketName(SocketHandle s, uint32_t* hostAddress, uint16_t* port);

// sendto: bytes sent or kSocketError.
int SendTo(SocketHandle s, const void* data, size_t length, uint32_t hostAddress, uint16_t port);

// Waits like select for one socket: 1 readable, 0 timeout, kSocketError on failure or when the
// calling thread's owner asked it to stop (LastSocketError() is then kErrInterrupted).
// timeoutMs -1 waits without limit.
int WaitSocketReadable(SocketHandle s, int timeoutMs);

// recvfrom: byte count, or kSocketError. A datagram longer than the capacity is consumed and
// reported as kSocketError with kErrMessageSize, as Windows does.
int ReceiveFrom(SocketHandle s, void* buffer, size_t capacity, uint32_t* fromHostAddress,
                uint16_t* fromPort);

// Connects a stream socket, waiting at most timeoutMs (-1: the system's own limit). 0 on
// success, otherwise kSocketError with LastSocketError() the reason (kErrTimedOut,
// kErrInterrupted when the calling thread's owner asked it to stop).
int ConnectSocket(SocketHandle s, uint32_t hostAddress, uint16_t port, int timeoutMs);

// send on a connected socket: bytes sent or kSocketError.
int Send(SocketHandle s, const void* data, size_t length);

// One recv: byte count (0 when a stream's peer closed), or kSocketError. A datagram longer than
// the capacity is reported as kSocketError with kErrMessageSize, as Windows does.
int Receive(SocketHandle s, void* buffer, size_t capacity);

// Counts the descriptors this process has open (a leak check for tests and diagnostics). On
// Windows: the sockets opened through this layer and not closed yet.
int CountOpenDescriptors();

}  // namespace platform
