// What a command-line host needs from the console: whether stderr is a terminal, and Ctrl-C or
// SIGTERM turned into a descriptor it can wait on.
#pragma once

namespace platform {

bool IsStderrTerminal();

// From the first call on, SIGINT and SIGTERM no longer end the process; the returned descriptor
// becomes readable instead (and stays so). -1 on failure.
int InterruptDescriptor();
bool InterruptRequested();

}  // namespace platform
