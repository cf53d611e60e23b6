// The module's type library where the platform keeps type libraries (oleaut32 on Windows): the
// registered library first, else the one embedded in the module's file. IDispatch of the dual
// interfaces is then served by the platform from it. Linux has no such service: the module
// describes its library itself (automation/).
#pragma once

#include "platform/system_names.h"

#include <nqportmanager/com.h>

namespace platform {

// Library libid 1.0, loaded once and held until the module unloads (no reference is added).
// Null where there is none.
ITypeLib* ModuleTypeLibrary(REFGUID libid);

}  // namespace platform
