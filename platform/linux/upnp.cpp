#include "platform/upnp.h"

#include <miniupnpc/miniupnpc.h>

#include <atomic>
#include <memory>

#include "platform/kernel.h"

// UPNP_GetValidIGD took two more arguments and renumbered its results in API 18; the mapping
// of results to "found" below is for API 17 (miniupnpc 2.2.x).
#if MINIUPNPC_API_VERSION >= 18
#error "revisit GatewayPresent for the results of UPNP_GetValidIGD in this miniupnpc"
#endif

namespace platform {

namespace {

// Version 1 types only: a version 2 device must answer them too. No "upnp:rootdevice": every
// media server and TV answers it, and their descriptions would be fetched for nothing.
const char* const kGatewayTypes[] = {
    "urn:schemas-upnp-org:device:InternetGatewayDevice:1",
    "urn:schemas-upnp-org:service:WANIPConnection:1",
    "urn:schemas-upnp-org:service:WANPPPConnection:1",
    nullptr,
};

struct DeviceListDeleter {
    void operator()(UPNPDev* list) const { freeUPNPDevlist(list); }
};
using DeviceList = std::unique_ptr<UPNPDev, DeviceListDeleter>;

// The URLs UPNP_GetValidIGD allocates; freeing the zeroed struct is harmless.
class GatewayUrls {
  public:
    GatewayUrls() = default;
    ~GatewayUrls() { FreeUPNPUrls(&urls_); }
    GatewayUrls(const GatewayUrls&) = delete;
    GatewayUrls& operator=(const GatewayUrls&) = delete;
    UPNPUrls* Get() { return &urls_; }

  private:
    UPNPUrls urls_{};
};

class MiniupnpcGatewayProbe final : public UpnpGatewayProbe {
  public:
    bool GatewayPresent() override {
        if (CurrentThreadStopRequested()) {
            return false;
        }
        // searchalltypes: every search goes out at once and they share one wait, instead of
        // one wait per type (four seconds and more without a gateway). miniupnpc cannot wait
        // less than a second nor be woken, so the stop is seen after the wait. No minissdpd
        // (""): its cache may describe the network before a change, and it is shared by every
        // network namespace of the host.
        int error = 0;
        DeviceList devices(upnpDiscoverDevices(kGatewayTypes, kUpnpSearchMs, nullptr, "",
                                               UPNP_LOCAL_PORT_ANY, 0, 2, &error, 1));
        if (!devices || CurrentThreadStopRequested()) {
            return false;
        }
        GatewayUrls urls;
        IGDdatas data{};
        char lanAddress[64] = {};
        const int result =
            UPNP_GetValidIGD(devices.get(), urls.Get(), &data, lanAddress, sizeof lanAddress);
        // 1: a connected IGD. 2: an IGD that reports no connection or whose external address
        // is reserved (a gateway behind another NAT, or a documentation address in a lab); the
        // operating system's object hands out its mapping collection all the same. 3: a device
        // that answered but has no WAN connection service, so it cannot map ports: not a
        // gateway.
        return result == 1 || result == 2;
    }
};

}  // namespace

UpnpGatewayProbe& SystemUpnpGatewayProbe() {
    static MiniupnpcGatewayProbe probe;
    return probe;
}

}  // namespace platform
