// Running a short command to completion from a test (lab set-up, a CLI under test).
#pragma once

#include <string>
#include <vector>

namespace platform::testing {

// Runs argv (argv[0] looked up in PATH, then in the sbin folders), waits for it, and returns its
// exit code (128 + signal when a signal ended it, -1 when it could not be started). Its standard
// output is collected into *output when output is not null; standard error goes to the test's own.
int RunCommand(const std::vector<std::string>& argv, std::string* output = nullptr);

}  // namespace platform::testing

namespace platform::testing {

// The path of the running executable, so a test can run itself somewhere else.
std::string CurrentExecutable();

}  // namespace platform::testing
