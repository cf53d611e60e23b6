// The real classic STUN server (Debian's stund) as a test peer: started on two loopback addresses
// of this process's own (127.X.Y.1 and 127.X.Y.2, X.Y derived from the pid, so parallel test
// processes do not meet) with ports 3478 and 3479, trusted only once all four sockets are bound,
// and ended with the fixture.
#pragma once

#include <cstdint>
#include <string>

#include <gtest/gtest.h>

#include "tests/support/os/process.h"

namespace testsupport {

class Stund {
  public:
    static constexpr uint16_t kPrimaryPort = 3478;
    static constexpr uint16_t kAlternatePort = 3479;

    static bool IsInstalled();

    Stund() = default;
    ~Stund();
    Stund(const Stund&) = delete;
    Stund& operator=(const Stund&) = delete;

    // Starts stund and waits until its four sockets are bound. On false, error says why.
    bool Start(std::string* error = nullptr);
    void Stop();

    // Host order. Requests to Primary():kPrimaryPort get correct SOURCE and CHANGED-ADDRESS.
    uint32_t PrimaryAddress() const { return primary_; }
    uint32_t AlternateAddress() const { return primary_ + 1; }

  private:
    bool TryStart(uint32_t primary, std::string* error);

    platform::testing::Process process_;
    uint32_t primary_ = 0;
    std::string logFile_;
};

// Gives each test a running stund; skips the test when stund is not installed.
class StundTest : public ::testing::Test {
  protected:
    void SetUp() override;

    Stund stund_;
};

}  // namespace testsupport
