// The nqpm subcommands. Each takes the arguments after its name and returns the exit code.
#pragma once

namespace nqpm {

int RunBinding(int argc, char** argv);

}  // namespace nqpm
