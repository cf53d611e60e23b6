#include "platform/netchange.h"

#include <winsock2.h>

#include <iphlpapi.h>
#include <windows.h>

#include "platform/win32/handle.h"

namespace platform {

// Both notifications complete on one manual-reset event, so that a caller waits on one handle.
struct NetworkChangeWatcher::Pending {
    HANDLE event = nullptr;
    HANDLE addressHandle = nullptr;
    HANDLE routeHandle = nullptr;
    OVERLAPPED address{};
    OVERLAPPED route{};
    bool addressArmed = false;
    bool routeArmed = false;
    bool failed = false;

    bool ArmAddress() {
        address = OVERLAPPED{};
        address.hEvent = event;
        addressArmed = NotifyAddrChange(&addressHandle, &address) == ERROR_IO_PENDING;
        return addressArmed;
    }
    bool ArmRoute() {
        route = OVERLAPPED{};
        route.hEvent = event;
        routeArmed = NotifyRouteChange(&routeHandle, &route) == ERROR_IO_PENDING;
        return routeArmed;
    }
    ~Pending() {
        if (addressArmed) {
            CancelIPChangeNotify(&address);
        }
        if (routeArmed) {
            CancelIPChangeNotify(&route);
        }
        if (event != nullptr) {
            CloseHandle(event);
        }
    }
};

NetworkChangeWatcher::NetworkChangeWatcher() : pending_(std::make_unique<Pending>()) {
    pending_->event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    // Either kind alone is still worth watching: some systems offer only one.
    if (pending_->event == nullptr || (!pending_->ArmAddress() & !pending_->ArmRoute())) {
        pending_.reset();
    }
}

NetworkChangeWatcher::~NetworkChangeWatcher() = default;

int NetworkChangeWatcher::Descriptor() const {
    return pending_ ? DescriptorOf(pending_->event) : -1;
}

NetworkChanges NetworkChangeWatcher::Read() {
    NetworkChanges changes;
    if (!pending_) {
        return changes;
    }
    Pending& p = *pending_;
    ResetEvent(p.event);
    DWORD bytes = 0;
    if (p.addressArmed && HasOverlappedIoCompleted(&p.address)) {
        changes.addresses = true;
        GetOverlappedResult(p.addressHandle, &p.address, &bytes, FALSE);
        p.ArmAddress();
    }
    if (p.routeArmed && HasOverlappedIoCompleted(&p.route)) {
        changes.routes = true;
        GetOverlappedResult(p.routeHandle, &p.route, &bytes, FALSE);
        p.ArmRoute();
    }
    changes.failed = !p.addressArmed && !p.routeArmed;
    return changes;
}

}  // namespace platform
