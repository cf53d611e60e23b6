// What a test leaves behind in the process: descriptors, threads and network namespaces of its
// own. The suite's main installs the check around every test.
#pragma once

#include <gtest/gtest.h>

#include <map>
#include <string>

namespace testsupport {

struct ProcessResources {
    std::map<std::string, std::string> descriptors;  // number -> what it refers to
    std::map<std::string, std::string> threads;      // thread id -> name
    std::map<std::string, std::string> namespaces;   // this process's network namespaces

    static ProcessResources Now();
};

// Fails a test that ends with more descriptors, threads or namespaces than it started with,
// naming each. Threads get a short grace while they finish after being told to stop.
class LeakCheck : public ::testing::EmptyTestEventListener {
  public:
    void OnTestStart(const ::testing::TestInfo&) override;
    void OnTestEnd(const ::testing::TestInfo&) override;

  private:
    ProcessResources before_;
};

}  // namespace testsupport
