// Notifications of IPv4 address and routing table changes, as a descriptor the caller waits on
// (with platform::WaitReadable, so that the owner's stop request wakes it too).
#pragma once

#include <cstddef>
#include <memory>

#include "platform/net.h"

namespace platform {

// What arrived since the last read; the two kinds are served separately by the callers.
struct NetworkChanges {
    bool addresses = false;  // an IPv4 address was added or removed
    bool routes = false;     // an IPv4 route was added or removed
    bool failed = false;     // the socket broke (not just an overflow): nothing more will come
};

// Subscribes to the kernel's IPv4 address and route notifications at construction and owns
// the socket that receives them.
class NetworkChangeWatcher {
  public:
    NetworkChangeWatcher();
#ifdef _WIN32
    ~NetworkChangeWatcher();

    bool IsOpen() const {
        return pending_ != nullptr;
    }
    // Signalled while a notification (NotifyAddrChange, NotifyRouteChange) has completed.
    int Descriptor() const;
#else
    bool IsOpen() const {
        return socket_.IsValid();
    }
    // Readable while notifications are queued; -1 when not open.
    int Descriptor() const {
        return socket_.Get();
    }
#endif
    // Reads every queued notification without blocking. When the kernel had to drop some (the
    // receive buffer overflowed), both kinds are reported, since either may have been lost.
    NetworkChanges Read();

  private:
#ifdef _WIN32
    struct Pending;
    std::unique_ptr<Pending> pending_;
#else
    Socket socket_;
#endif
};

#ifndef _WIN32
// The kinds named by a datagram of the kernel's route notifications. Stops at the first header
// that does not fit in the remaining bytes; anything after it is ignored.
NetworkChanges ParseNetworkChanges(const void* data, size_t length);
#endif

}  // namespace platform
