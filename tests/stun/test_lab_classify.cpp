// Every NAT and firewall behaviour of the lab, classified end to end through `nqpm classify`
// running on the lab's client host against the real stund.
#include <gtest/gtest.h>

#include <sstream>
#include <string>
#include <vector>

#include "tests/support/os/command.h"

#include "tests/support/Json.h"
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

using testsupport::ParseJson;

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
    const nlohmann::json results = ParseJson(out)["results"];
    ASSERT_EQ(results.size(), 1u) << out;
    const nlohmann::json& r = results[0];
    EXPECT_EQ(r["local"], lab.Info("CLIENT_ADDR")) << out;
    EXPECT_EQ(r["result"], e.result) << out;
    if (!e.hasPublic) {
        EXPECT_TRUE(r["public"].is_null()) << out;
    } else {
        EXPECT_EQ(r["public"], lab.Info(e.publicIsClient ? "CLIENT_ADDR" : "PUBLIC_ADDR")) << out;
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

namespace {

// Without --local every usable address is classified, in the order the system lists them: the
// lab's client gets a second interface with a direct, unfiltered path to the server host.
TEST(LabClassifyAll, EveryUsableAddressIsClassifiedInListOrder) {
    if (!testsupport::NatLab::CanRun()) {
        GTEST_SKIP() << "needs root, nftables and stund";
    }
    testsupport::NatLab lab(testsupport::NatLab::UniqueName(20), "port-restricted-cone-nat");
    ASSERT_TRUE(lab.Up());
    const std::string cli = lab.Info("CLIENT_NS");
    const std::string srv = lab.Info("SERVER_NS");
    const auto ip = [](const std::string& ns, const std::string& args) {
        std::vector<std::string> argv = {"ip", "-n", ns};
        std::istringstream words(args);
        for (std::string w; words >> w;) {
            argv.push_back(w);
        }
        return platform::testing::RunCommand(argv);
    };
    ASSERT_EQ(ip(cli, "link add eth1 type veth peer name direct netns " + srv), 0);
    ASSERT_EQ(ip(cli, "addr add 192.0.2.130/25 dev eth1"), 0);
    ASSERT_EQ(ip(cli, "link set eth1 up"), 0);
    ASSERT_EQ(ip(srv, "addr add 192.0.2.129/25 dev direct"), 0);
    ASSERT_EQ(ip(srv, "link set direct up"), 0);
    // A default gateway of its own makes it usable; its traffic leaves through it.
    ASSERT_EQ(ip(cli, "route add default via 192.0.2.129 dev eth1 metric 200"), 0);
    ASSERT_EQ(ip(cli, "rule add from 192.0.2.130 table 100"), 0);
    ASSERT_EQ(ip(cli, "route add default via 192.0.2.129 dev eth1 table 100"), 0);

    const std::string nqpm = std::string(NQPM_BINARY_DIR) + "/bin/nqpm";
    std::string out;
    ASSERT_EQ(lab.RunInClient({nqpm, "classify", "--stun", lab.Info("STUN1"), "--json"}, &out), 0);
    const std::string expected =
        "{\"results\":[{\"local\":\"10.99.0.2\",\"result\":\"STUN_RESULT_PORT_RESTRICTED_CONE_"
        "NAT\","
        "\"code\":5,\"public\":\"198.51.100.254\"},{\"local\":\"192.0.2.130\",\"result\":"
        "\"STUN_RESULT_OPEN\",\"code\":1,\"public\":\"192.0.2.130\"}]";
    EXPECT_EQ(out.substr(0, expected.size()), expected) << out;
}

}  // namespace
