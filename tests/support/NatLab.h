// A NAT lab of network namespaces (tools/lab/natlab.sh) owned by one test: built in the
// constructor's Up(), always removed by the destructor.
#pragma once

#include <map>
#include <string>
#include <vector>

namespace testsupport {

class NatLab {
  public:
    // name: 1-6 characters [a-z0-9], unique among labs that exist at the same time.
    NatLab(std::string name, std::string behaviour, std::vector<std::string> options = {});
    ~NatLab();
    NatLab(const NatLab&) = delete;
    NatLab& operator=(const NatLab&) = delete;

    // Builds the lab; false (with the script's complaint on stderr) when it could not.
    bool Up();
    // CLIENT_NS, NAT_NS, SERVER_NS, CLIENT_ADDR, PUBLIC_ADDR, STUN1, STUN2, BEHAVIOUR.
    std::string Info(const std::string& key) const;
    // Runs argv inside a namespace of the lab; returns the exit code, stdout into *output.
    int Run(const std::string& ns, const std::vector<std::string>& argv,
            std::string* output = nullptr) const;
    int RunInClient(const std::vector<std::string>& argv, std::string* output = nullptr) const {
        return Run(Info("CLIENT_NS"), argv, output);
    }

    static bool CanRun();  // root, and the script and its tools are there
    static std::string Script();
    // A lab name unique to this process and the given tag.
    static std::string UniqueName(int tag);

  private:
    std::string name_;
    std::string behaviour_;
    std::vector<std::string> options_;
    std::map<std::string, std::string> info_;
    bool up_ = false;
};

}  // namespace testsupport
