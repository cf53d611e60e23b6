// Whether the network has a UPnP Internet gateway device: the stand-in for the operating
// system's UPnP NAT object, which the port manager asks before it falls back to STUN.
#pragma once

namespace platform {

// How long a search listens for gateways (ms). All searches share this one wait, so a host
// without a gateway knows after about this long; an answering gateway adds one description fetch
// and one control request on the LAN.
inline constexpr int kUpnpSearchMs = 1000;

// The source of the answer. Objects that ask take one; tests pass a double.
class UpnpGatewayProbe {
  public:
    virtual ~UpnpGatewayProbe() = default;
    // Searches the calling thread's network. True when an Internet gateway device answered,
    // also one that reports a reserved external address or no connection, as the operating
    // system's object does. Blocks for about kUpnpSearchMs; false, early where it can, when the
    // calling thread is asked to stop.
    virtual bool GatewayPresent() = 0;
};

// The system's probe; the default wherever a probe is taken.
UpnpGatewayProbe& SystemUpnpGatewayProbe();

}  // namespace platform
