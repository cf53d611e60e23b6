#include <gtest/gtest.h>

#include <algorithm>
#include <vector>

#include "portmanager/DiscoveryDecision.h"
#include "stun/STUNResults.h"

namespace {

using portmanager::DecideDiscovery;
using portmanager::DiscoveryInput;
using Answer = portmanager::DiscoveryInput::Answer;
using namespace stun;

constexpr uint32_t A = 0xC000020A;  // 192.0.2.10
constexpr uint32_t B = 0xC000020B;  // 192.0.2.11
constexpr uint32_t P = 0xC6336407;  // 198.51.100.7
constexpr uint32_t Q = 0xCB007109;  // 203.0.113.9
constexpr uint32_t none = kNoPublicAddress;

struct Row {
    const char* what;
    Answer answer;
    std::vector<STUNResultEntry> entries;
    // Before: the private address known ("" none) and the local addresses of the host.
    const char* privateBefore;
    std::vector<uint32_t> localIps;
    // After (ignored when the STUN pass is started instead).
    bool startStun;
    PM_TOPOLOGY topology = PMT_UNKNOWN;
    const char* privateIp = "";
    const char* publicIp = "";
    const char* sipServer = "";
    bool stunAddressesInUse = false;
    bool upnpEnabled = false;
    bool stunDisabled = false;
};

TEST(DiscoveryDecision, EveryAnswerGivesItsTopologyAddressesAndRecommendations) {
    const char* sip = "sip.example.net";
    const char* media = "media.example.net";
    const auto GW = PMT_UPNP_ENABLED_NAT_OR_FIREWALL;
    const auto UNK = PMT_UNKNOWN;
    // clang-format off
    const Row rows[] = {
        {"gateway keeps the addresses", Answer::UpnpGateway, {}, "192.0.2.99", {A},
         false, GW, "192.0.2.99", "203.0.113.50", sip, false, true},
        {"no gateway goes on to STUN", Answer::NoUpnpGateway, {}, "", {A}, true},
        {"no gateway, STUN disabled", Answer::NoUpnpGateway, {}, "", {A},
         false, UNK, "192.0.2.10", "192.0.2.10", media, false, false, true},
        {"nothing to discover with keeps a known private address", Answer::NoDiscovery, {},
         "192.0.2.99", {A}, false, UNK, "192.0.2.99", "192.0.2.99", media, false},
        {"least restrictive chosen", Answer::StunResults,
         {{A, STUN_RESULT_SYMMETRIC_NAT, none}, {B, STUN_RESULT_FULL_CONE_NAT, Q}}, "", {A},
         false, PMT_STUN_FULL_CONE_NAT, "192.0.2.11", "203.0.113.9", sip, true},
        {"unclassified first entry stays chosen", Answer::StunResults,
         {{A, STUN_RESULT_UNKNOWN, 0}, {B, STUN_RESULT_OPEN, Q}}, "", {A},
         false, UNK, "192.0.2.10", "192.0.2.10", media, false},
        {"equal results keep the first", Answer::StunResults,
         {{A, STUN_RESULT_RESTRICTED_CONE_NAT, P}, {B, STUN_RESULT_RESTRICTED_CONE_NAT, Q}}, "",
         {A}, false, PMT_STUN_RESTRICTED_CONE_NAT, "192.0.2.10", "198.51.100.7", sip, true},
        {"open", Answer::StunResults, {{B, STUN_RESULT_OPEN, P}}, "", {A},
         false, PMT_STUN_OPEN, "192.0.2.11", "198.51.100.7", sip, true},
        {"full cone firewall", Answer::StunResults, {{B, STUN_RESULT_FULL_CONE_FIREWALL, P}}, "",
         {A}, false, PMT_STUN_FULL_CONE_FIREWALL, "192.0.2.11", "198.51.100.7", sip, true},
        {"port restricted", Answer::StunResults, {{B, STUN_RESULT_PORT_RESTRICTED_CONE_NAT, P}},
         "", {A}, false, PMT_STUN_PORT_RESTRICTED_CONE_NAT, "192.0.2.11", "198.51.100.7", sip, true},
        {"symmetric firewall", Answer::StunResults, {{B, STUN_RESULT_SYMMETRIC_FIREWALL, P}}, "",
         {A}, false, PMT_STUN_SYMMETRIC_FIREWALL, "192.0.2.11", "192.0.2.11", media, false},
        {"symmetric NAT", Answer::StunResults, {{B, STUN_RESULT_SYMMETRIC_NAT, P}}, "", {A},
         false, PMT_STUN_SYMMETRIC_NAT, "192.0.2.11", "192.0.2.11", media, false},
        {"blocked falls back to the first local address", Answer::StunResults,
         {{B, STUN_RESULT_BLOCKED, none}}, "", {A, B},
         false, PMT_STUN_BLOCKED, "192.0.2.10", "192.0.2.10", media, false},
        {"blocked without any local address", Answer::StunResults,
         {{B, STUN_RESULT_BLOCKED, none}}, "", {}, false, PMT_STUN_BLOCKED, "", "", media, false},
        {"empty list", Answer::StunResults, {}, "", {A},
         false, UNK, "192.0.2.10", "192.0.2.10", media, false},
        {"value outside the results", Answer::StunResults, {{B, 9, P}}, "", {A},
         false, UNK, "192.0.2.11", "192.0.2.11", media, false},
    };
    // clang-format on
    for (const Row& r : rows) {
        SCOPED_TRACE(r.what);
        STUNResultList list;
        list.count = static_cast<int32_t>(r.entries.size());
        std::copy(r.entries.begin(), r.entries.end(), list.entries);
        DiscoveryInput in;
        in.answer = r.answer;
        in.stunResults = &list;
        in.stunDisabled = r.stunDisabled;
        in.sipProxy = sip;
        in.mediaProxy = media;
        if (*r.privateBefore != '\0') {
            in.privateIp = r.privateBefore;
            in.publicIp = "203.0.113.50";
        }
        in.localIps = r.localIps;
        const auto out = DecideDiscovery(in);
        EXPECT_EQ(out.startStun, r.startStun);
        if (r.startStun) {
            continue;
        }
        EXPECT_EQ(out.topology, r.topology);
        EXPECT_EQ(out.privateIp.value_or(""), r.privateIp);
        EXPECT_EQ(out.publicIp.value_or(""), r.publicIp);
        EXPECT_EQ(out.sipServer, r.sipServer);
        EXPECT_EQ(out.stunAddressesInUse, r.stunAddressesInUse);
        EXPECT_EQ(out.upnpEnabled, r.upnpEnabled);
        EXPECT_EQ(out.unknownStunResult.has_value(),
                  r.entries.size() == 1 && r.entries[0].stunResult == 9);
    }
}

}  // namespace
