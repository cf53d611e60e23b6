// Every NAT and firewall behaviour of the lab, classified end to end through `nqpm classify`
// running on the lab's client host against the real stund.
#include <gtest/gtest.h>

#include <string>

#include "tests/support/NatLab.h"

namespace {

struct Expectation {
    const char* behaviour;
    const char* result;
    bool publicIsClient;  // open and firewall kinds: the client's own address
    bool hasPublic;
};

const Expectation kBehaviours[] = {
    {"open", "STUN_RESULT_OPEN", true, true},
    {"full-cone-firewall", "STUN_RESULT_FULL_CONE_FIREWALL", true, true},
    {"symmetric-firewall", "STUN_RESULT_SYMMETRIC_FIREWALL", true, true},
    {"full-cone-nat", "STUN_RESULT_FULL_CONE_NAT", false, true},
    {"restricted-cone-nat", "STUN_RESULT_RESTRICTED_CONE_NAT", false, true},
    {"port-restricted-cone-nat", "STUN_RESULT_PORT_RESTRICTED_CONE_NAT", false, true},
    {"symmetric-nat", "STUN_RESULT_SYMMETRIC_NAT", false, false},
    {"blocked", "STUN_RESULT_BLOCKED", false, false},
};

// The value of "key": in a flat JSON text (strings unquoted; null stays null).
std::string JsonField(const std::string& json, const std::string& key) {
    const std::string tag = "\"" + key + "\":";
    const auto at = json.find(tag);
    if (at == std::string::npos) {
        return "<missing>";
    }
    auto start = at + tag.size();
    if (json.compare(start, 4, "null") == 0) {
        return "null";
    }
    if (json[start] == '"') {
        const auto end = json.find('"', start + 1);
        return json.substr(start + 1, end - start - 1);
    }
    const auto end = json.find_first_of(",}", start);
    return json.substr(start, end - start);
}

class LabClassify : public ::testing::TestWithParam<int> {};

TEST_P(LabClassify, NqpmClassifyNamesTheLabsBehaviourAndPublicAddress) {
    if (!testsupport::NatLab::CanRun()) {
        GTEST_SKIP() << "needs root, nftables and stund";
    }
    const Expectation& e = kBehaviours[GetParam()];
    testsupport::NatLab lab(testsupport::NatLab::UniqueName(GetParam()), e.behaviour);
    ASSERT_TRUE(lab.Up());
    const std::string nqpm = std::string(NQPM_BINARY_DIR) + "/bin/nqpm";
    std::string out;
    ASSERT_EQ(lab.RunInClient({nqpm, "classify", "--stun", lab.Info("STUN1"), "--local",
                               lab.Info("CLIENT_ADDR"), "--json"},
                              &out),
              0);
    EXPECT_EQ(JsonField(out, "local"), lab.Info("CLIENT_ADDR")) << out;
    EXPECT_EQ(JsonField(out, "result"), e.result) << out;
    if (!e.hasPublic) {
        EXPECT_EQ(JsonField(out, "public"), "null") << out;
    } else if (e.publicIsClient) {
        EXPECT_EQ(JsonField(out, "public"), lab.Info("CLIENT_ADDR")) << out;
    } else {
        EXPECT_EQ(JsonField(out, "public"), lab.Info("PUBLIC_ADDR")) << out;
    }
}

INSTANTIATE_TEST_SUITE_P(Behaviours, LabClassify,
                         ::testing::Range(0, static_cast<int>(std::size(kBehaviours))),
                         [](const ::testing::TestParamInfo<int>& info) {
                             std::string name = kBehaviours[info.param].behaviour;
                             for (auto& c : name) {
                                 c = c == '-' ? '_' : c;
                             }
                             return name;
                         });

}  // namespace
