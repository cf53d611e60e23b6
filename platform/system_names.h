// Windows' headers turn a few names into their A or W forms by macro; the platform layer's own
// functions of those names keep theirs. Included first by the platform headers that declare them.
#pragma once

#ifdef _WIN32
#include <nqportmanager/comtypes.h>
#undef OutputDebugString
#undef PostMessage
#undef ReplaceFile
// The same values as platform::WM_TIMER and platform::WM_USER, which the callers name.
#undef WM_TIMER
#undef WM_USER
#endif
