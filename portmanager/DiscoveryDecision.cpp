#include "portmanager/DiscoveryDecision.h"

#include <algorithm>

#include "stun/STUNResults.h"

namespace portmanager {

namespace {

bool HasText(const std::optional<std::string>& text) {
    return text && !text->empty();
}

// Through the media proxy, with the known private address (or the first local one) as both.
void FallBack(const DiscoveryInput& in, DiscoveryOutcome& out) {
    out.topology = PMT_UNKNOWN;
    out.upnpEnabled = false;
    out.sipServer = in.mediaProxy;
    out.stunAddressesInUse = false;
    if (!HasText(out.privateIp) && !in.localIps.empty()) {
        out.privateIp = stun::FormatHostOrderAddress(in.localIps.front());
    }
    out.publicIp = out.privateIp;
}

void UseStunAddresses(const DiscoveryInput& in, const stun::STUNResultEntry& entry,
                      DiscoveryOutcome& out) {
    out.privateIp = stun::FormatHostOrderAddress(entry.localAddress);
    out.publicIp = stun::FormatHostOrderAddress(entry.publicAddress);
    out.sipServer = in.sipProxy;
    out.upnpEnabled = false;
    out.stunAddressesInUse = true;
}

void DecideStun(const DiscoveryInput& in, DiscoveryOutcome& out) {
    const stun::STUNResultList& list = *in.stunResults;
    const int32_t count = std::min<int32_t>(list.count, stun::kMaxSTUNResults);
    if (count <= 0) {
        FallBack(in, out);
        return;
    }
    // The least restrictive classified address: results run from open (1) to blocked (8), and
    // an unclassified first entry (0) stays the choice.
    const stun::STUNResultEntry* chosen = &list.entries[0];
    for (int32_t i = 1; i < count; ++i) {
        const auto r = static_cast<int8_t>(list.entries[i].stunResult);
        if (r != 0 && r < static_cast<int8_t>(chosen->stunResult)) {
            chosen = &list.entries[i];
        }
    }
    const uint8_t r = chosen->stunResult;
    switch (r) {
        case stun::STUN_RESULT_UNKNOWN:
        case stun::STUN_RESULT_BLOCKED:
            FallBack(in, out);
            break;
        case stun::STUN_RESULT_OPEN:
        case stun::STUN_RESULT_FULL_CONE_FIREWALL:
        case stun::STUN_RESULT_FULL_CONE_NAT:
        case stun::STUN_RESULT_RESTRICTED_CONE_NAT:
        case stun::STUN_RESULT_PORT_RESTRICTED_CONE_NAT:
            UseStunAddresses(in, *chosen, out);
            break;
        default:
            out.unknownStunResult = r;
            [[fallthrough]];
        case stun::STUN_RESULT_SYMMETRIC_FIREWALL:
        case stun::STUN_RESULT_SYMMETRIC_NAT:
            // The private address is the classified one; the traffic goes through the proxy.
            UseStunAddresses(in, *chosen, out);
            FallBack(in, out);
            break;
    }
    // Set last, so that the fall-back's PMT_UNKNOWN does not overwrite it.
    out.topology = r <= stun::STUN_RESULT_BLOCKED ? static_cast<PM_TOPOLOGY>(r) : PMT_UNKNOWN;
}

}  // namespace

DiscoveryOutcome DecideDiscovery(const DiscoveryInput& in) {
    DiscoveryOutcome out;
    out.privateIp = in.privateIp;
    out.publicIp = in.publicIp;
    switch (in.answer) {
        case DiscoveryInput::Answer::UpnpGateway:
            out.topology = PMT_UPNP_ENABLED_NAT_OR_FIREWALL;
            out.upnpEnabled = true;
            out.sipServer = in.sipProxy;
            break;
        case DiscoveryInput::Answer::NoUpnpGateway:
            if (in.stunDisabled) {
                FallBack(in, out);
            } else {
                out.startStun = true;
            }
            break;
        case DiscoveryInput::Answer::StunResults:
            if (in.stunResults != nullptr) {
                DecideStun(in, out);
            } else {
                FallBack(in, out);
            }
            break;
        case DiscoveryInput::Answer::NoDiscovery:
            FallBack(in, out);
            break;
    }
    return out;
}

}  // namespace portmanager
