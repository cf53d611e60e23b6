// Classification and the whole discovery end to end, `nqpm` on the lab's client host: against the
// real stund behind each NAT behaviour, and against a real UPnP gateway (miniupnpd).
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tests/support/Json.h"
#include "tests/support/NatLab.h"

namespace {

// What the client's host is seen as from the server's side.
enum class Seen { kClient, kBox, kNothing };

struct Expectation {
    const char* behaviour;
    const char* result;  // the STUN verdict; the topology is its PMT_STUN_ counterpart
    Seen seen;
    bool direct;  // the SIP proxy and the STUN suffix, else the media proxy
};

const Expectation kBehaviours[] = {
    {"open", "OPEN", Seen::kClient, true},
    {"full-cone-firewall", "FULL_CONE_FIREWALL", Seen::kClient, true},
    {"symmetric-firewall", "SYMMETRIC_FIREWALL", Seen::kClient, false},
    {"full-cone-nat", "FULL_CONE_NAT", Seen::kBox, true},
    {"restricted-cone-nat", "RESTRICTED_CONE_NAT", Seen::kBox, true},
    {"port-restricted-cone-nat", "PORT_RESTRICTED_CONE_NAT", Seen::kBox, true},
    {"symmetric-nat", "SYMMETRIC_NAT", Seen::kNothing, false},
    {"blocked", "BLOCKED", Seen::kNothing, false},
};

constexpr const char* kSipProxy = "sip.example.net:5060";
constexpr const char* kMediaProxy = "media.example.net";

using testsupport::ParseJson;

std::string Nqpm(const testsupport::NatLab& lab, std::vector<std::string> args) {
    std::string out;
    args.insert(args.begin(), std::string(NQPM_BINARY_DIR) + "/bin/nqpm");
    args.push_back("--json");
    EXPECT_EQ(lab.RunInClient(args, &out), 0);
    return out;
}

std::string Discover(const testsupport::NatLab& lab) {
    return Nqpm(lab, {"discover", "--stun", lab.Info("STUN1"), "--sip-proxy", kSipProxy,
                      "--media-proxy", kMediaProxy});
}

std::string TestName(std::string name) {
    for (auto& c : name) {
        c = c == '-' ? '_' : c;
    }
    return name;
}

// Each behaviour of the lab against the real stund: first classified alone (`nqpm classify`),
// then the whole discovery with UPnP enabled and no gateway (`nqpm discover`).
class LabBehaviour : public ::testing::TestWithParam<int> {};

TEST_P(LabBehaviour, ClassifyNamesItAndDiscoveryGoesOnToStunAndRecommendsForIt) {
    if (!testsupport::NatLab::CanRun()) {
        GTEST_SKIP() << "needs root, nftables and stund";
    }
    const Expectation& e = kBehaviours[GetParam()];
    testsupport::NatLab lab(testsupport::NatLab::UniqueName(GetParam()), e.behaviour);
    ASSERT_TRUE(lab.Up());
    const std::string client = lab.Info("CLIENT_ADDR");
    const std::string box = lab.Info("PUBLIC_ADDR");

    std::string out = Nqpm(lab, {"classify", "--stun", lab.Info("STUN1"), "--local", client});
    const nlohmann::json results = ParseJson(out)["results"];
    ASSERT_EQ(results.size(), 1u) << out;
    EXPECT_EQ(results[0]["local"], client) << out;
    EXPECT_EQ(results[0]["result"], std::string("STUN_RESULT_") + e.result) << out;
    if (e.seen == Seen::kNothing) {
        EXPECT_TRUE(results[0]["public"].is_null()) << out;
    } else {
        EXPECT_EQ(results[0]["public"], e.seen == Seen::kBox ? box : client) << out;
    }

    out = Discover(lab);
    nlohmann::json j = ParseJson(out);
    EXPECT_EQ(j["state"], "PMS_COMPLETED") << out;
    EXPECT_EQ(j["topology"], std::string("PMT_STUN_") + e.result) << out;
    EXPECT_EQ(j["private"], client) << out;
    EXPECT_EQ(j["public"], e.seen == Seen::kBox ? box : client) << out;
    EXPECT_EQ(j["recommended_sip_server"], e.direct ? kSipProxy : kMediaProxy) << out;
    EXPECT_EQ(j["client_name_suffix"], e.direct ? "STUN" : "") << out;
    EXPECT_EQ(j["recommended_upnp_enabled"], false) << out;
    EXPECT_EQ(j["recommended_port_manager"], true) << out;
}

INSTANTIATE_TEST_SUITE_P(Behaviours, LabBehaviour,
                         ::testing::Range(0, static_cast<int>(std::size(kBehaviours))),
                         [](const ::testing::TestParamInfo<int>& info) {
                             return TestName(kBehaviours[info.param].behaviour);
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
                             return TestName(info.param);
                         });

}  // namespace
