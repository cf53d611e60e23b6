// Moving the calling thread into an existing named network namespace (one that `ip netns add`
// made) for a while: sockets it opens meanwhile stay in that namespace.
#pragma once

#include <string>

namespace platform::testing {

class NamedNetnsEntry {
  public:
    explicit NamedNetnsEntry(const std::string& name);
    ~NamedNetnsEntry();  // back to the thread's own namespace
    NamedNetnsEntry(const NamedNetnsEntry&) = delete;
    NamedNetnsEntry& operator=(const NamedNetnsEntry&) = delete;

    bool Entered() const { return original_ >= 0; }

  private:
    int original_ = -1;
};

}  // namespace platform::testing
