// nqpm without a lab: option parsing in-process, then the executable's exit codes, usage
// messages, JSON shapes and its end on SIGINT/SIGTERM, against stund on loopback at most.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>

#include <chrono>
#include <fstream>
#include <iterator>
#include <string>
#include <thread>
#include <vector>

#include "stun/STUNResults.h"
#include "tests/support/Json.h"
#include "tests/support/Stund.h"
#include "tests/support/os/command.h"
#include "tests/support/os/process.h"
#include "tools/nqpm/Cli.h"

namespace {

using nqpm::Options;
using nqpm::UsageError;
using testsupport::ParseJson;

const std::string kNqpm = std::string(NQPM_BINARY_DIR) + "/bin/nqpm";

// Parses argv (without the command name) against --stun VALUE, --tag VALUE... and --flag.
Options Parsed(std::vector<std::string> args) {
    Options options("test", {{"stun", true}, {"tag", true, true}, {"flag", false}}, "usage");
    std::vector<char*> argv;
    for (auto& a : args) {
        argv.push_back(a.data());
    }
    options.Parse(static_cast<int>(argv.size()), argv.data());
    return options;
}

TEST(NqpmOptions, ParseAcceptsValuesFlagsAndRepeatsAndRefusesTheRest) {
    const Options o = Parsed({"--stun=a", "--flag", "--tag", "x", "--tag", "y", "-h", "--json"});
    EXPECT_EQ(o.Value("stun"), "a");
    EXPECT_TRUE(o.Has("flag") && o.WantsHelp() && o.Json());
    EXPECT_EQ(o.Values("tag"), (std::vector<std::string>{"x", "y"}));

    const struct {
        std::vector<std::string> args;
        const char* message;
    } kBad[] = {
        {{"--nope"}, "unknown option --nope"},
        {{"--stun"}, "option --stun needs a value"},
        {{"--stun", "a", "--stun", "b"}, "option --stun given twice"},
        {{"--flag=1"}, "option --flag takes no value"},
        {{"stray"}, "unexpected argument 'stray'"},
    };
    for (const auto& bad : kBad) {
        SCOPED_TRACE(bad.message);
        try {
            Parsed(bad.args);
            ADD_FAILURE() << "accepted";
        } catch (const UsageError& e) {
            EXPECT_EQ(std::string(e.what()), bad.message);
        }
    }
}

TEST(NqpmOptions, ValueParsersRefuseWhatIsOutOfRange) {
    EXPECT_EQ(nqpm::ParseHostPort("p", "host", 5060).port, 5060);
    const nqpm::HostPort hp = nqpm::ParseHostPort("p", "10.0.0.1:65535", 5060);
    EXPECT_EQ(hp.host + ":" + std::to_string(hp.port), "10.0.0.1:65535");
    EXPECT_EQ(nqpm::ParseDottedQuad("a", "192.0.2.255"), 0xC00002FFu);
    for (const char* bad : {"host:0", "host:65536", "host:", ":5060", "host:5x"}) {
        EXPECT_THROW(nqpm::ParseHostPort("p", bad, 5060), UsageError) << bad;
    }
    for (const char* bad : {"1.2.3", "1.2.3.256", "1.2.3.4.", "1..2.3", "a.b.c.d", "1.2.3.0004"}) {
        EXPECT_THROW(nqpm::ParseDottedQuad("a", bad), UsageError) << bad;
    }
    const Options o = Parsed({"--stun", "70000", "--tag", "2.5"});
    EXPECT_THROW(o.Integer("stun", 1, 65535), UsageError);
    EXPECT_EQ(o.Seconds("tag", 0), 2.5);
    EXPECT_EQ(o.Seconds("flag", 7), 7);  // absent: the fall-back
    EXPECT_THROW(Parsed({"--tag", "-1"}).Seconds("tag", 0), UsageError);
}

// Runs nqpm with the arguments; its stdout and stderr apart.
struct NqpmRun {
    int code;
    std::string out;
    std::string err;
};
NqpmRun RunNqpm(const std::vector<std::string>& args) {
    const std::string errFile = ::testing::TempDir() + "nqpm-stderr-" +
                                std::to_string(platform::testing::CurrentProcessId());
    std::string command = "exec '" + kNqpm + "'";
    for (const auto& a : args) {
        command += " '" + a + "'";
    }
    NqpmRun r;
    r.code = platform::testing::RunCommand({"sh", "-c", command + " 2>'" + errFile + "'"}, &r.out);
    std::ifstream in(errFile);
    r.err.assign(std::istreambuf_iterator<char>(in), {});
    return r;
}

TEST(NqpmExit, BadUsageGivesTwoAndOneLineNamingTheCommand) {
    const std::vector<std::vector<std::string>> kBad = {
        {},
        {"frobnicate"},
        {"binding"},
        {"binding", "--stun", "h:99999"},
        {"classify", "--stun", "x", "--local", "1.2.3"},
        {"discover", "--stun", "x", "--timeout", "soon"},
        {"profile", "--stun", "x", "--no-upnp"},
        {"monitor", "--bogus"},
        {"diagnose", "--stun", "s", "--echo", "e"},
        {"diagnose", "--well-known", "host.example", "--stun", "s", "--echo", "e"},
        {"diagnose", "--well-known", "192.0.2.1", "--stun", "s", "--echo", "e:0"},
        {"diagnose", "--well-known", "192.0.2.1", "--stun", "s", "--echo", "e", "--timeout", "-1"},
        {"proxy", "--stun", "x", "--sip-proxy", "s", "--media-proxy", "m"},
        {"proxy", "--internal", "10.0.0", "--stun", "x", "--sip-proxy", "s", "--media-proxy", "m"},
        {"proxy", "--internal", "10.0.0.5", "--stun", "x", "--sip-proxy", "s", "--media-proxy", "m",
         "--min-port", "20000"},
    };
    for (const auto& args : kBad) {
        const NqpmRun r = RunNqpm(args);
        SCOPED_TRACE(r.err);
        EXPECT_EQ(r.code, 2);
        EXPECT_TRUE(r.out.empty());
        if (!args.empty()) {  // a bare nqpm prints the whole usage
            EXPECT_EQ(r.err.find('\n'), r.err.size() - 1);
            EXPECT_EQ(r.err.rfind("nqpm", 0), 0u);
        }
    }
    const NqpmRun help = RunNqpm({"discover", "--help"});
    EXPECT_EQ(help.code, 0);
    EXPECT_EQ(help.out.rfind("usage: nqpm discover", 0), 0u);
}

class NqpmStund : public testsupport::StundTest {};

TEST_F(NqpmStund, BindingPrintsTheAnswerAsJsonAndFailsWithNullsWhenUnanswered) {
    const std::string server = stun::FormatHostOrderAddress(stund_.PrimaryAddress());
    const NqpmRun answered =
        RunNqpm({"binding", "--stun", server, "--local", "127.0.0.1", "--json"});
    ASSERT_EQ(answered.code, 0) << answered.err;
    nlohmann::json j = ParseJson(answered.out);
    EXPECT_EQ(j["mapped"], "127.0.0.1:" + std::to_string(j["local_port"].get<int>()));
    EXPECT_EQ(j["source"], server + ":3478");
    EXPECT_EQ(j["changed"], stun::FormatHostOrderAddress(stund_.AlternateAddress()) + ":3479");
    EXPECT_TRUE(j["reflected"].is_null());
    EXPECT_EQ(j["from"], server + ":3478");

    // A port nobody answers on: 6 requests over about 4.7 s, then exit 1.
    const NqpmRun silent =
        RunNqpm({"binding", "--stun", server + ":9", "--local", "127.0.0.1", "--json"});
    EXPECT_EQ(silent.code, 1);
    j = ParseJson(silent.out);
    for (const char* key : {"mapped", "source", "changed", "reflected", "from"}) {
        EXPECT_TRUE(j[key].is_null()) << key;
    }
}

TEST(NqpmDiscover, WithBothDiscoveriesOffReportsAtOnceAndAWatchEndsOnSignals) {
    const NqpmRun r =
        RunNqpm({"discover", "--no-upnp", "--no-stun", "--media-proxy", "m.example", "--json"});
    ASSERT_EQ(r.code, 0) << r.err;
    nlohmann::json j = ParseJson(r.out);
    EXPECT_EQ(j["state"], "PMS_COMPLETED");
    EXPECT_EQ(j["recommended_sip_server"], "m.example");
    EXPECT_EQ(j["recommended_upnp_enabled"], false);

    for (const int signal : {SIGINT, SIGTERM}) {
        SCOPED_TRACE(signal);
        const std::string outFile = ::testing::TempDir() + "nqpm-watch-" +
                                    std::to_string(platform::testing::CurrentProcessId());
        std::remove(outFile.c_str());
        platform::testing::Process watch;
        ASSERT_TRUE(watch.Start({kNqpm, "discover", "--no-upnp", "--no-stun", "--json", "--watch"},
                                outFile));
        // The report is printed once the loop runs; until then a signal would find no loop.
        std::string printed;
        for (int i = 0; i < 250 && printed.find('\n') == std::string::npos; ++i) {
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
            std::ifstream in(outFile);
            printed.assign(std::istreambuf_iterator<char>(in), {});
        }
        ASSERT_NE(printed.find("PMS_COMPLETED"), std::string::npos) << printed;
        ASSERT_EQ(kill(watch.Pid(), signal), 0);
        // Stop waits 2 s before it kills: a clean exit 0 means the loop ended on the signal.
        const int status = watch.Stop(2000);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    }
}

TEST(NqpmRegistry, RegisterPrintsTheClassAndUnregisterLeavesTheSharedKeys) {
    const std::string file = ::testing::TempDir() + "nqpm-registry-" +
                             std::to_string(platform::testing::CurrentProcessId()) + ".json";
    std::remove(file.c_str());
    ASSERT_EQ(RunNqpm({"register", "--registry", file}).code, 0);
    NqpmRun listed = RunNqpm({"registry", "--registry", file, "--json"});
    ASSERT_EQ(listed.code, 0) << listed.err;
    std::string server;
    const nlohmann::json keys = ParseJson(listed.out)["keys"];
    for (const auto& key : keys) {
        if (key["key"].get<std::string>().find("\\InprocServer32") != std::string::npos) {
            server = key["values"]["@"].get<std::string>();
        }
    }
    EXPECT_NE(server.find("/lib/libNqPortManager.so"), std::string::npos) << listed.out;
    ASSERT_EQ(RunNqpm({"unregister", "--registry", file}).code, 0);
    listed = RunNqpm({"registry", "--registry", file, "--json"});
    EXPECT_EQ(ParseJson(listed.out)["keys"].size(), 3u) << listed.out;  // AppID, CLSID, TypeLib
    const NqpmRun missing = RunNqpm({"register", "--module", "/nonexistent.so"});
    EXPECT_EQ(missing.code, 1);
    EXPECT_NE(missing.err.find("/nonexistent.so"), std::string::npos);
    std::remove(file.c_str());
}

TEST(NqpmAutomation, TypeinfoPrintsTheLibraryAndInvokeCallsMembersByName) {
    const NqpmRun types = RunNqpm({"typeinfo", "--json"});
    ASSERT_EQ(types.code, 0) << types.err;
    const nlohmann::json library = ParseJson(types.out);
    EXPECT_EQ(library["library"]["help"], "NqPortManager 1.0 Type Library");
    ASSERT_EQ(library["types"].size(), 14u);
    const nlohmann::json& state = library["types"][5]["members"][5];  // IAdvancedPortManager
    EXPECT_EQ(state["name"], "State");
    EXPECT_EQ(state["params"][0]["type"], "PM_STATE*");

    const std::string file = ::testing::TempDir() + "nqpm-invoke-" +
                             std::to_string(platform::testing::CurrentProcessId()) + ".json";
    ASSERT_EQ(RunNqpm({"register", "--registry", file}).code, 0);
    const NqpmRun calls =
        RunNqpm({"invoke", "--registry", file, "--json", "NqPortManager.AdvancedPortManager",
                 "State", ";", "ErrorCanBeDiagnosed", "x"});
    EXPECT_EQ(calls.code, 1);
    EXPECT_EQ(ParseJson(calls.out)["result"]["name"], "PMS_UNINITIALIZED") << calls.out;
    EXPECT_NE(calls.err.find("0x80020005"), std::string::npos) << calls.err;
    std::remove(file.c_str());
}

}  // namespace
