// Classification of every usable address end to end through `nqpm classify` on the lab's client
// host against the real stund. Each behaviour alone is classified with the discovery's lab tests.
#include <gtest/gtest.h>

#include <sstream>
#include <string>
#include <vector>

#include "tests/support/os/command.h"

#include "tests/support/Json.h"
#include "tests/support/NatLab.h"

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
