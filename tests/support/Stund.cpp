#include "tests/support/Stund.h"

#include <chrono>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "foundation/NetUtils.h"

namespace testsupport {

namespace {

constexpr const char* kBinary = "stund";
constexpr int kCandidates = 8;
constexpr auto kReadyTimeout = std::chrono::seconds(5);

// 127.X.Y.1 with X in 1..254 (never 127.0/16, which other tests use) and Y from the pid.
uint32_t PrimaryForCandidate(int pid, int candidate) {
    const unsigned key = static_cast<unsigned>(pid) + static_cast<unsigned>(candidate);
    const uint32_t x = 1 + (key / 256) % 254;
    const uint32_t y = key % 256;
    return (127u << 24) | (x << 16) | (y << 8) | 1u;
}

bool AllListening(uint32_t primary) {
    for (uint32_t address : {primary, primary + 1}) {
        for (uint16_t port : {Stund::kPrimaryPort, Stund::kAlternatePort}) {
            if (!platform::testing::IsUdpListening(address, port)) {
                return false;
            }
        }
    }
    return true;
}

bool AnyListening(uint32_t primary) {
    for (uint32_t address : {primary, primary + 1}) {
        for (uint16_t port : {Stund::kPrimaryPort, Stund::kAlternatePort}) {
            if (platform::testing::IsUdpListening(address, port)) {
                return true;
            }
        }
    }
    return false;
}

std::string ReadFile(const std::string& path) {
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

}  // namespace

bool Stund::IsInstalled() {
    return !platform::testing::FindExecutable(kBinary).empty();
}

Stund::~Stund() {
    Stop();
}

void Stund::Stop() {
    process_.Stop();
    if (!logFile_.empty()) {
        std::error_code ignored;
        std::filesystem::remove(logFile_, ignored);
        logFile_.clear();
    }
}

bool Stund::Start(std::string* error) {
    if (process_.IsRunning()) {
        return true;
    }
    const int pid = platform::testing::CurrentProcessId();
    std::string why = "no free loopback address pair";
    for (int candidate = 0; candidate < kCandidates; ++candidate) {
        const uint32_t primary = PrimaryForCandidate(pid, candidate);
        // Someone else's sockets there: a stund started now would fail its bind and exit 0.
        if (AnyListening(primary)) {
            continue;
        }
        if (TryStart(primary, &why)) {
            return true;
        }
    }
    if (error != nullptr) {
        *error = why;
    }
    return false;
}

bool Stund::TryStart(uint32_t primary, std::string* error) {
    Stop();
    const std::string a1 = foundation::FormatHostAddress(primary);
    const std::string a2 = foundation::FormatHostAddress(primary + 1);
    logFile_ = (std::filesystem::temp_directory_path() /
                ("nqpm-stund-" + std::to_string(platform::testing::CurrentProcessId()) + "-" + a1 +
                 ".log"))
                   .string();
    if (!process_.Start({kBinary, "-h", a1, "-a", a2, "-p", std::to_string(kPrimaryPort), "-o",
                         std::to_string(kAlternatePort)},
                        logFile_)) {
        *error = "cannot start stund";
        return false;
    }
    const auto deadline = std::chrono::steady_clock::now() + kReadyTimeout;
    while (std::chrono::steady_clock::now() < deadline) {
        if (AllListening(primary)) {
            primary_ = primary;
            return true;
        }
        // stund reports a failed bind only in its output and still exits 0.
        if (!process_.IsRunning()) {
            break;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    *error = "stund on " + a1 + "/" + a2 + " did not bind its four sockets: " + ReadFile(logFile_);
    Stop();
    return false;
}

void StundTest::SetUp() {
    if (!Stund::IsInstalled()) {
        GTEST_SKIP() << "stund (Debian stun-server) is not installed";
    }
    std::string error;
    ASSERT_TRUE(stund_.Start(&error)) << error;
}

}  // namespace testsupport
