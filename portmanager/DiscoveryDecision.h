// What a discovery concludes from what it learnt (the UPnP answer or the STUN results), the
// client's flags and proxies and the addresses known before: a pure function, so that every
// outcome can be checked without a message loop.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include <nqportmanager/NqPortManager.h>

#include "stun/STUNResult.h"

namespace portmanager {

struct DiscoveryInput {
    enum class Answer { UpnpGateway, NoUpnpGateway, StunResults, NoDiscovery };
    Answer answer = Answer::NoDiscovery;
    const stun::STUNResultList* stunResults = nullptr;  // with StunResults
    bool stunDisabled = false;
    std::string sipProxy;
    std::string mediaProxy;
    std::optional<std::string> privateIp;  // known before this answer
    std::optional<std::string> publicIp;
    std::vector<uint32_t> localIps;  // host order; the fall-back's address when none is known
};

// Every conclusion completes the discovery, unless startStun asks for the STUN pass first.
struct DiscoveryOutcome {
    bool startStun = false;
    PM_TOPOLOGY topology = PMT_UNKNOWN;
    bool upnpEnabled = false;
    bool stunAddressesInUse = false;
    std::string sipServer;
    std::optional<std::string> privateIp;
    std::optional<std::string> publicIp;
    // The chosen STUN result when it is none of the known ones: the caller logs it.
    std::optional<uint8_t> unknownStunResult;
};

DiscoveryOutcome DecideDiscovery(const DiscoveryInput& input);

}  // namespace portmanager
