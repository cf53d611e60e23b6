#include "tests/support/DnsLab.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "platform/kernel.h"
#include "tests/support/os/command.h"
#include "tests/support/os/netns.h"

namespace testsupport {

namespace {
constexpr const char* kInsideVariable = "NQPM_INSIDE_DNS_LAB";
}

DnsLab::DnsLab(std::vector<std::string> hostRecords, bool nameServer)
    : name_("nqdns" + std::to_string(platform::testing::CurrentProcessId())),
      hostRecords_(std::move(hostRecords)),
      nameServer_(nameServer) {}

DnsLab::~DnsLab() {
    dnsmasq_.Stop();
    if (created_) {
        platform::testing::RunCommand({"ip", "netns", "delete", name_});
        std::error_code ignored;
        std::filesystem::remove_all("/etc/netns/" + name_, ignored);
    }
    std::error_code ignored;
    std::filesystem::remove("/tmp/" + name_ + "-dnsmasq.log", ignored);
}

bool DnsLab::InsideDnsLab() {
    return std::getenv(kInsideVariable) != nullptr;
}

bool DnsLab::Up(std::string* why) {
    if (!platform::testing::IsRoot() ||
        (nameServer_ && platform::testing::FindExecutable("dnsmasq").empty())) {
        *why = "needs root and dnsmasq";
        return false;
    }
    if (platform::testing::RunCommand({"ip", "netns", "add", name_}) != 0) {
        *why = "cannot create a network namespace";
        return false;
    }
    created_ = true;
    platform::testing::RunCommand({"ip", "-n", name_, "link", "set", "lo", "up"});
    // `ip netns exec` shows this file as /etc/resolv.conf inside the namespace. One short try:
    // a look-up abandoned by its stopped owner lives on in the resolver's thread until then.
    std::filesystem::create_directories("/etc/netns/" + name_);
    std::ofstream("/etc/netns/" + name_ + "/resolv.conf")
        << "nameserver 127.0.0.1\noptions timeout:1 attempts:1\n";
    if (!nameServer_) {
        return true;
    }
    const std::string log = "/tmp/" + name_ + "-dnsmasq.log";
    std::vector<std::string> command = {"ip",
                                        "netns",
                                        "exec",
                                        name_,
                                        "dnsmasq",
                                        "--keep-in-foreground",
                                        "--no-resolv",
                                        "--no-hosts",
                                        "--bind-interfaces",
                                        "--listen-address=127.0.0.1",
                                        "--local=/lab.test/",
                                        std::string("--host-record=") + kKnownName + ",127.0.0.1",
                                        "--pid-file=",
                                        "--user=root"};
    for (const std::string& record : hostRecords_) {
        command.push_back("--host-record=" + record);
    }
    if (!dnsmasq_.Start(command, log)) {
        *why = "dnsmasq did not start";
        return false;
    }
    for (int attempt = 0; attempt < 50; ++attempt) {
        std::string listening;
        platform::testing::RunCommand(
            {"ip", "netns", "exec", name_, "ss", "-Hlun", "sport", "=", ":53"}, &listening);
        if (listening.find("127.0.0.1:53") != std::string::npos) {
            return true;
        }
        platform::Sleep(100);
    }
    *why = "dnsmasq does not answer";
    return false;
}

int DnsLab::RunSelf(const std::string& testName) const {
    return platform::testing::RunCommand(
        {"ip", "netns", "exec", name_, "env", std::string(kInsideVariable) + "=1",
         platform::testing::CurrentExecutable(), "--gtest_filter=" + testName});
}

}  // namespace testsupport
