// Network namespaces that a test makes for itself: created by name, configured with `ip -n`,
// entered by the test's thread, and deleted again however the test ends.
#pragma once

#include <string>
#include <vector>

namespace platform::testing {

bool IsRoot();

class ScopedNetns {
  public:
    // Creates a namespace named prefix-<pid>-<n> with its loopback interface up.
    explicit ScopedNetns(const std::string& prefix);
    // Returns an entered thread to its namespace, then deletes the namespace.
    ~ScopedNetns();
    ScopedNetns(const ScopedNetns&) = delete;
    ScopedNetns& operator=(const ScopedNetns&) = delete;

    bool IsValid() const { return valid_; }
    const std::string& Name() const { return name_; }

    // `ip -n NAME` followed by the blank-separated arguments; true when it succeeded.
    bool Ip(const std::string& arguments) const;

    // Moves the calling thread into the namespace: its sockets, its view of interfaces and
    // routes and the threads it starts from now on live there. Leave (or the destructor) must
    // run on the same thread.
    bool Enter();
    void Leave();

  private:
    std::string name_;
    bool valid_ = false;
    int originalFd_ = -1;  // the entering thread's own namespace while entered
};

}  // namespace platform::testing
