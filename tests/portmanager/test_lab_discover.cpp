// The whole discovery end to end: `nqpm discover` on the lab's client host, with UPnP enabled,
// against the real stund behind each NAT behaviour, and against a real UPnP gateway (miniupnpd).
#include <gtest/gtest.h>

#include <string>

#include "tests/support/Json.h"
#include "tests/support/NatLab.h"

namespace {

struct Expectation {
    const char* behaviour;
    const char* topology;
    bool publicIsBox;  // the NAT's outside address, else the client's own
    bool viaSipProxy;  // else the media proxy
    bool stunSuffix;
};

const Expectation kBehaviours[] = {
    {"open", "PMT_STUN_OPEN", false, true, true},
    {"full-cone-firewall", "PMT_STUN_FULL_CONE_FIREWALL", false, true, true},
    {"symmetric-firewall", "PMT_STUN_SYMMETRIC_FIREWALL", false, false, false},
    {"full-cone-nat", "PMT_STUN_FULL_CONE_NAT", true, true, true},
    {"restricted-cone-nat", "PMT_STUN_RESTRICTED_CONE_NAT", true, true, true},
    {"port-restricted-cone-nat", "PMT_STUN_PORT_RESTRICTED_CONE_NAT", true, true, true},
    {"symmetric-nat", "PMT_STUN_SYMMETRIC_NAT", false, false, false},
    {"blocked", "PMT_STUN_BLOCKED", false, false, false},
};

constexpr const char* kSipProxy = "sip.example.net:5060";
constexpr const char* kMediaProxy = "media.example.net";

using testsupport::ParseJson;

std::string Discover(const testsupport::NatLab& lab) {
    std::string out;
    const std::string nqpm = std::string(NQPM_BINARY_DIR) + "/bin/nqpm";
    EXPECT_EQ(lab.RunInClient({nqpm, "discover", "--stun", lab.Info("STUN1"), "--sip-proxy",
                               kSipProxy, "--media-proxy", kMediaProxy, "--json"},
                              &out),
              0);
    return out;
}

class LabDiscover : public ::testing::TestWithParam<int> {};

TEST_P(LabDiscover, NoGatewayGoesOnToStunAndRecommendsForTheLabsBehaviour) {
    if (!testsupport::NatLab::CanRun()) {
        GTEST_SKIP() << "needs root, nftables and stund";
    }
    const Expectation& e = kBehaviours[GetParam()];
    testsupport::NatLab lab(testsupport::NatLab::UniqueName(GetParam()), e.behaviour);
    ASSERT_TRUE(lab.Up());
    const std::string out = Discover(lab);
    nlohmann::json j = ParseJson(out);
    const std::string client = lab.Info("CLIENT_ADDR");
    EXPECT_EQ(j["state"], "PMS_COMPLETED") << out;
    EXPECT_EQ(j["topology"], e.topology) << out;
    EXPECT_EQ(j["private"], client) << out;
    EXPECT_EQ(j["public"], e.publicIsBox ? lab.Info("PUBLIC_ADDR") : client) << out;
    EXPECT_EQ(j["recommended_sip_server"], e.viaSipProxy ? kSipProxy : kMediaProxy) << out;
    EXPECT_EQ(j["client_name_suffix"], e.stunSuffix ? "STUN" : "") << out;
    EXPECT_EQ(j["recommended_upnp_enabled"], false) << out;
    EXPECT_EQ(j["recommended_port_manager"], true) << out;
}

INSTANTIATE_TEST_SUITE_P(Behaviours, LabDiscover,
                         ::testing::Range(0, static_cast<int>(std::size(kBehaviours))),
                         [](const ::testing::TestParamInfo<int>& info) {
                             std::string name = kBehaviours[info.param].behaviour;
                             for (auto& c : name) {
                                 c = c == '-' ? '_' : c;
                             }
                             return name;
                         });

class LabDiscoverUpnp : public ::testing::TestWithParam<const char*> {};

TEST_P(LabDiscoverUpnp, RealGatewayGivesTheUpnpTopologyAndTheSipProxy) {
    if (!testsupport::NatLab::CanRun()) {
        GTEST_SKIP() << "needs root, nftables and stund";
    }
    testsupport::NatLab lab(testsupport::NatLab::UniqueName(8 + (GetParam()[0] == 's')), GetParam(),
                            {"--upnp"});
    ASSERT_TRUE(lab.Up());
    const std::string out = Discover(lab);
    nlohmann::json j = ParseJson(out);
    EXPECT_EQ(j["state"], "PMS_COMPLETED") << out;
    EXPECT_EQ(j["topology"], "PMT_UPNP_ENABLED_NAT_OR_FIREWALL") << out;
    EXPECT_EQ(j["topology_code"], 9) << out;
    EXPECT_EQ(j["recommended_sip_server"], kSipProxy) << out;
    EXPECT_EQ(j["recommended_upnp_enabled"], true) << out;
    EXPECT_EQ(j["client_name_suffix"], "") << out;
    // A first discovery that found a gateway has learnt no address.
    EXPECT_EQ(j["private"], "") << out;
    EXPECT_EQ(j["recommended_port_manager"], false) << out;
}

INSTANTIATE_TEST_SUITE_P(Gateways, LabDiscoverUpnp,
                         ::testing::Values("full-cone-nat", "symmetric-nat"),
                         [](const ::testing::TestParamInfo<const char*>& info) {
                             std::string name = info.param;
                             for (auto& c : name) {
                                 c = c == '-' ? '_' : c;
                             }
                             return name;
                         });

}  // namespace
