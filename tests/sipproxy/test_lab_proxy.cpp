// `nqpm proxy` behind a port restricted cone NAT: sipp registers through it with a real
// Kamailio registrar, which stores the proxy's public contact, and the 200 OK comes back; a call
// from the server's side then reaches the client through the registrar and the proxy.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "platform/kernel.h"
#include "tests/support/Json.h"
#include "tests/support/NatLab.h"
#include "tests/support/os/process.h"

namespace {

using platform::testing::FindExecutable;
using platform::testing::Process;

constexpr const char* kServer = "203.0.113.1";  // the lab's server host

std::string Read(const std::string& file) {
    std::ifstream in(file);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

class LabProxy : public ::testing::Test {
  protected:
    void SetUp() override {
        if (!testsupport::NatLab::CanRun() || FindExecutable("kamailio").empty() ||
            FindExecutable("kamcmd").empty() || FindExecutable("sipp").empty()) {
            GTEST_SKIP() << "needs root, nftables, stund, kamailio and sipp";
        }
        dir = ::testing::TempDir() + "nqpm-lab-proxy-" +
              std::to_string(platform::testing::CurrentProcessId()) + "/";
        std::filesystem::create_directories(dir);
        ASSERT_TRUE(lab.Up());
    }

    void TearDown() override {
        kamailio.Stop();
        if (!dir.empty() && !HasFailure()) {
            std::filesystem::remove_all(dir);  // kept for a look when the test failed
        }
    }

    // Kamailio in the server's namespace, trusted once its control socket answers.
    void StartRegistrar() {
        control = dir + "kamailio.ctl";
        std::string config =
            Read(std::string(NQPM_SOURCE_DIR) + "/tests/sipproxy/kamailio/registrar.cfg.in");
        config.replace(config.find("@LISTEN@"), 8, std::string(kServer) + ":5060");
        config.replace(config.find("@CONTROL@"), 9, control);
        std::ofstream(dir + "kamailio.cfg") << config;
        ASSERT_TRUE(kamailio.Start({"ip", "netns", "exec", lab.Info("SERVER_NS"), "kamailio", "-f",
                                    dir + "kamailio.cfg", "-DD", "-E", "-Y", dir},
                                   dir + "kamailio.log"));
        for (int i = 0; i < 100; ++i) {
            if (Kamcmd("core.version", nullptr) == 0) {
                return;
            }
            platform::Sleep(50);
        }
        FAIL() << "kamailio did not come up: " << Read(dir + "kamailio.log");
    }
    int Kamcmd(const std::string& command, std::string* out) {
        return lab.Run(lab.Info("SERVER_NS"), {"kamcmd", "-s", "unix:" + control, command}, out);
    }

    testsupport::NatLab lab{testsupport::NatLab::UniqueName(41), "port-restricted-cone-nat"};
    std::string dir;
    std::string control;
    Process kamailio;
};

TEST_F(LabProxy, SippRegistersWithThePublicContactAndACallComesBack) {
    StartRegistrar();
    const std::string client = lab.Info("CLIENT_ADDR");
    Process nqpm;
    ASSERT_TRUE(nqpm.Start(
        {"ip", "netns", "exec", lab.Info("CLIENT_NS"), std::string(NQPM_BINARY_DIR) + "/bin/nqpm",
         "proxy", "--internal", client, "--stun", lab.Info("STUN1"), "--no-upnp", "--sip-proxy",
         std::string(kServer) + ":5060", "--media-proxy", "203.0.113.2", "--duration", "60",
         "--json"},
        dir + "nqpm.out"));
    std::string first;
    for (int i = 0; i < 200 && first.find('\n') == std::string::npos; ++i) {
        platform::Sleep(50);
        first = Read(dir + "nqpm.out");
    }
    ASSERT_NE(first.find('\n'), std::string::npos) << "nqpm proxy printed nothing: " << first;
    const auto started = testsupport::ParseJson(first.substr(0, first.find('\n')));
    ASSERT_TRUE(started.is_object());
    const std::string sender = started["sender_endpoint"].get<std::string>();
    const std::string contact = started["public_contact"].get<std::string>();
    EXPECT_EQ(sender.rfind(client + ":", 0), 0u) << first;
    EXPECT_EQ(contact.rfind(lab.Info("PUBLIC_ADDR") + ":", 0), 0u) << first;
    EXPECT_EQ(started["server"].get<std::string>(), std::string(kServer) + ":5060");

    const std::string log = dir + "uac.log";
    EXPECT_EQ(
        lab.RunInClient({"sipp", "-sf",
                         std::string(NQPM_SOURCE_DIR) + "/tests/sipproxy/sipp/register_uac.xml",
                         sender, "-i", client, "-p", "5062", "-m", "1", "-nostdin", "-trace_logs",
                         "-log_file", log, "-timeout", "10s"}),
        0)
        << Read(log);
    // The 200 OK reached the client with its own contact again.
    EXPECT_NE(Read(log).find("contact Contact: <sip:alice@" + client + ":5062>"), std::string::npos)
        << Read(log);
    std::string dump;
    ASSERT_EQ(Kamcmd("ul.dump", &dump), 0);
    EXPECT_NE(dump.find("Address: sip:alice@" + contact + "\n"), std::string::npos) << dump;

    // A call from the server's side to the registered contact: the registrar forwards it to the
    // public contact, the proxy to the client, and the answers go back the same way.
    Process callee;
    ASSERT_TRUE(callee.Start({"ip", "netns", "exec", lab.Info("CLIENT_NS"), "sipp", "-sn", "uas",
                              "-i", client, "-p", "5062", "-m", "1", "-nostdin", "-timeout", "20s"},
                             dir + "callee.out"));
    platform::Sleep(300);  // sipp binds its socket
    std::string callerScreen;
    EXPECT_EQ(lab.Run(lab.Info("SERVER_NS"),
                      {"sipp", "-sn", "uac", std::string(kServer) + ":5060", "-s", "alice", "-i",
                       lab.Info("STUN2"), "-p", "5070", "-m", "1", "-nostdin", "-timeout", "15s"},
                      &callerScreen),
              0)
        << callerScreen << Read(dir + "kamailio.log");
    EXPECT_EQ(callee.Stop(5000), 0) << Read(dir + "callee.out");

    EXPECT_EQ(nqpm.Stop(5000), 0);  // SIGTERM ends the relay, the process exits 0
    const std::string out = Read(dir + "nqpm.out");
    const auto finished = testsupport::ParseJson(out.substr(first.find('\n') + 1));
    ASSERT_TRUE(finished.is_object());
    // REGISTER; 180, 200 to the INVITE and 200 to the BYE. Back: 200; INVITE, ACK and BYE.
    EXPECT_EQ(finished["to_server"].get<int>(), 4) << out;
    EXPECT_EQ(finished["to_client"].get<int>(), 4) << out;
}

}  // namespace
