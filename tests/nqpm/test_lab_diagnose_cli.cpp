// nqpm diagnose in a namespace of the test's own: an interface with a default route, stund and
// the echo server fixture on its loopback.
#include <gtest/gtest.h>

#include "foundation/NetUtils.h"
#include "tests/support/EchoServer.h"
#include "tests/support/Json.h"
#include "tests/support/Stund.h"
#include "tests/support/os/command.h"
#include "tests/support/os/netns.h"

namespace {

using testsupport::EchoServer;

const std::string kNqpm = std::string(NQPM_BINARY_DIR) + "/bin/nqpm";

TEST(LabNqpmDiagnose, ReportsACleanRunAndAFaultOfEachStageWithItsCodeAndTestType) {
    if (!platform::testing::IsRoot() || !testsupport::Stund::IsInstalled()) {
        GTEST_SKIP() << "needs root and stund";
    }
    platform::testing::ScopedNetns ns("nqcli");
    ASSERT_TRUE(ns.IsValid());
    ASSERT_TRUE(ns.Ip("link add nqc0 type veth peer name nqc1"));
    ASSERT_TRUE(ns.Ip("addr add 10.78.0.2/24 dev nqc0"));
    ASSERT_TRUE(ns.Ip("link set nqc0 up"));
    ASSERT_TRUE(ns.Ip("link set nqc1 up"));
    ASSERT_TRUE(ns.Ip("route add default via 10.78.0.1"));
    ASSERT_TRUE(ns.Enter());  // nqpm and the peers started from here live in the namespace
    testsupport::Stund stund;
    std::string why;
    ASSERT_TRUE(stund.Start(&why)) << why;
    const std::string stun = foundation::FormatHostAddress(stund.PrimaryAddress());

    EchoServer::Options noReport;
    noReport.fault = EchoServer::Fault::kNoReport;
    EchoServer::Options noVideoRtcp;
    noVideoRtcp.missingHeader = "Video-RTCP-Port";
    // A clean run and a fault of each stage, as the client sees it: the failing test and its
    // code (every fault's code is the echo server tests' table).
    const struct {
        const char* name;
        EchoServer::Options options;
        int code;
        int type;
    } cases[] = {
        {"clean", {}, 0, 11},
        {"no report", noReport, 33, 7},
        {"no Video-RTCP-Port", noVideoRtcp, 24, 4},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        EchoServer echo(c.options);
        ASSERT_TRUE(echo.Start());
        std::string out;
        const int exit = platform::testing::RunCommand(
            {kNqpm, "diagnose", "--well-known", "192.0.2.1", "--stun", stun, "--echo",
             "127.0.0.1:" + std::to_string(echo.Port()), "--timeout", "500", "--json"},
            &out);
        EXPECT_EQ(exit, c.code == 0 ? 0 : 1);
        const nlohmann::json j = testsupport::ParseJson(out);
        EXPECT_EQ(j["error_code"], c.code);
        EXPECT_EQ(j["test_type"], c.type);
        EXPECT_EQ(j["cookie"], 1);
        ASSERT_EQ(j["tests"].size(), c.type == 4 ? 12u : 11u);
        EXPECT_EQ(j["tests"][0]["text"], "Interface Location Test");
        EXPECT_EQ(j["tests"][0]["error_code"], 0);
        if (c.code == 0) {
            EXPECT_EQ(j["error_text"], "Success");
            EXPECT_EQ(j["test_type_text"], "Echo Test/Large Packet");
            EXPECT_EQ(j["additional_info"].get<std::string>().rfind("(10.78.0.2:", 0), 0u);
        }
    }
}

}  // namespace
