#include "tests/support/LeakCheck.h"

#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "tests/support/NatLab.h"
#include "tests/support/os/process.h"

namespace testsupport {
namespace {

namespace fs = std::filesystem;

std::map<std::string, std::string> Entries(const fs::path& folder, bool readLinks,
                                           const char* nameFile = nullptr) {
    std::map<std::string, std::string> out;
    std::error_code ec;
    for (fs::directory_iterator it(folder, ec), end; !ec && it != end; it.increment(ec)) {
        const std::string key = it->path().filename().string();
        std::string value;
        if (readLinks) {
            std::error_code linkError;
            value = fs::read_symlink(it->path(), linkError).string();
        } else if (nameFile != nullptr) {
            std::ifstream in(it->path() / nameFile);
            std::getline(in, value);
        }
        out[key] = value;
    }
    return out;
}

// Names made by ScopedNetns (prefix-PID-N), DnsLab (nqdnsPID) and NatLab (a tag and the pid in
// base 36): parallel test processes make namespaces of their own, which are not this one's.
bool IsOurs(const std::string& name) {
    const std::string pid = std::to_string(platform::testing::CurrentProcessId());
    const std::string lab = NatLab::UniqueName(0).substr(1);
    return name.find(pid) != std::string::npos || name.find(lab) != std::string::npos;
}

template <typename Map>
std::string Extra(const Map& before, const Map& after) {
    std::string text;
    for (const auto& [key, value] : after) {
        if (before.count(key) == 0) {
            text += " " + key + (value.empty() ? "" : " (" + value + ")");
        }
    }
    return text;
}

}  // namespace

ProcessResources ProcessResources::Now() {
    ProcessResources r;
    r.descriptors = Entries("/proc/self/fd", true);
    // The listing's own descriptor.
    const std::string listing =
        "/proc/" + std::to_string(platform::testing::CurrentProcessId()) + "/fd";
    for (auto it = r.descriptors.begin(); it != r.descriptors.end();) {
        it = it->second == listing ? r.descriptors.erase(it) : std::next(it);
    }
    r.threads = Entries("/proc/self/task", false, "comm");
    for (const auto& [name, unused] : Entries("/run/netns", false)) {
        if (IsOurs(name)) {
            r.namespaces[name];
        }
    }
    return r;
}

void LeakCheck::OnTestStart(const ::testing::TestInfo&) {
    before_ = ProcessResources::Now();
}

void LeakCheck::OnTestEnd(const ::testing::TestInfo&) {
    // Threads told to stop may still be on their way out (the resolver's helpers among them).
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(3);
    ProcessResources after = ProcessResources::Now();
    while (!Extra(before_.threads, after.threads).empty() &&
           std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
        after = ProcessResources::Now();
    }
    const std::string descriptors = Extra(before_.descriptors, after.descriptors);
    const std::string threads = Extra(before_.threads, after.threads);
    const std::string namespaces = Extra(before_.namespaces, after.namespaces);
    EXPECT_EQ(descriptors, "") << "descriptors left open";
    EXPECT_EQ(threads, "") << "threads left running";
    EXPECT_EQ(namespaces, "") << "network namespaces left behind";
}

}  // namespace testsupport
