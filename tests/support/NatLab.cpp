#include "tests/support/NatLab.h"

#include <sstream>

#include "tests/support/os/command.h"
#include "tests/support/os/process.h"

namespace testsupport {

std::string NatLab::Script() {
    return std::string(NQPM_SOURCE_DIR) + "/tools/lab/natlab.sh";
}

bool NatLab::CanRun() {
    std::string uid;
    return platform::testing::RunCommand({"id", "-u"}, &uid) == 0 && uid == "0\n" &&
           !platform::testing::FindExecutable("nft").empty() &&
           !platform::testing::FindExecutable("stund").empty();
}

std::string NatLab::UniqueName(int tag) {
    // One character for the tag, up to five for the pid in base 36 (pids stay below 36^5).
    const char* digits = "0123456789abcdefghijklmnopqrstuvwxyz";
    std::string name(1, digits[tag % 36]);
    for (int pid = platform::testing::CurrentProcessId(); pid > 0; pid /= 36) {
        name += digits[pid % 36];
    }
    return name.substr(0, 6);
}

NatLab::NatLab(std::string name, std::string behaviour, std::vector<std::string> options)
    : name_(std::move(name)), behaviour_(std::move(behaviour)), options_(std::move(options)) {}

NatLab::~NatLab() {
    if (up_) {
        platform::testing::RunCommand({Script(), "down", name_});
    }
}

bool NatLab::Up() {
    std::vector<std::string> argv = {Script(), "up", name_, behaviour_};
    argv.insert(argv.end(), options_.begin(), options_.end());
    up_ = true;  // a half-built lab is removed too
    if (platform::testing::RunCommand(argv) != 0) {
        return false;
    }
    std::string text;
    if (platform::testing::RunCommand({Script(), "info", name_}, &text) != 0) {
        return false;
    }
    std::istringstream lines(text);
    std::string line;
    while (std::getline(lines, line)) {
        const auto eq = line.find('=');
        if (eq != std::string::npos) {
            info_[line.substr(0, eq)] = line.substr(eq + 1);
        }
    }
    return !Info("CLIENT_NS").empty();
}

std::string NatLab::Info(const std::string& key) const {
    auto it = info_.find(key);
    return it == info_.end() ? std::string() : it->second;
}

int NatLab::Run(const std::string& ns, const std::vector<std::string>& argv,
                std::string* output) const {
    std::vector<std::string> full = {"ip", "netns", "exec", ns};
    full.insert(full.end(), argv.begin(), argv.end());
    return platform::testing::RunCommand(full, output);
}

}  // namespace testsupport
