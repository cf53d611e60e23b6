#include "platform/console.h"

#include <io.h>
#include <stdio.h>

namespace platform {

bool IsStderrTerminal() {
    return _isatty(_fileno(stderr)) != 0;
}

}  // namespace platform
