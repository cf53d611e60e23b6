// What a command-line host needs from the console: whether stderr is a terminal. Ctrl-C and
// SIGTERM reach the host through its message loop (RouteInterruptsToMessageLoop, message.h).
#pragma once

namespace platform {

bool IsStderrTerminal();

}  // namespace platform
