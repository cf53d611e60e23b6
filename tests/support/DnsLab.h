// A network namespace with its own name server (dnsmasq on 127.0.0.1) that knows
// stun.lab.test and answers "no such name" for everything else below lab.test, so that name
// look-ups can be tested without any traffic leaving the machine. Tests run inside it by running
// their own executable there: RunSelf() with the test's name, and InsideDnsLab() in the child.
#pragma once

#include <string>
#include <vector>

#include "tests/support/os/process.h"

namespace testsupport {

class DnsLab {
  public:
    static constexpr const char* kKnownName = "stun.lab.test";  // resolves to 127.0.0.1
    static constexpr const char* kUnknownName = "no-such-host.lab.test";

    // hostRecords: further "NAME,ADDRESS" entries the name server knows. Without a name server
    // the namespace still names 127.0.0.1 as one, for a test to play it (or leave it silent).
    explicit DnsLab(std::vector<std::string> hostRecords = {}, bool nameServer = true);
    ~DnsLab();
    DnsLab(const DnsLab&) = delete;
    DnsLab& operator=(const DnsLab&) = delete;

    // False (and a GTEST skip reason in *why) when the lab cannot be built here.
    bool Up(std::string* why);
    // Runs this test executable inside the namespace with only the given test; its exit code.
    int RunSelf(const std::string& testName) const;

    // True in the child that RunSelf started.
    static bool InsideDnsLab();

  private:
    std::string name_;
    std::vector<std::string> hostRecords_;
    bool nameServer_;
    platform::testing::Process dnsmasq_;
    bool created_ = false;
};

}  // namespace testsupport

// The first lines of a test that runs inside a DnsLab: outside, it builds the lab (the macro's
// further arguments go to its constructor), runs `testName` (a --gtest_filter pattern) in it and
// returns; inside, the test's body goes on.
#define NQPM_RUN_INSIDE_DNS_LAB(testName, ...)    \
    if (!testsupport::DnsLab::InsideDnsLab()) {   \
        testsupport::DnsLab dnsLab_{__VA_ARGS__}; \
        std::string whyNot_;                      \
        if (!dnsLab_.Up(&whyNot_)) {              \
            GTEST_SKIP() << whyNot_;              \
        }                                         \
        EXPECT_EQ(dnsLab_.RunSelf(testName), 0);  \
        return;                                   \
    }
