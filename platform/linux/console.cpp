#include "platform/console.h"

#include <unistd.h>

namespace platform {

bool IsStderrTerminal() {
    return isatty(STDERR_FILENO) == 1;
}

}  // namespace platform
