// The type library NqPortManagerLib 1.0, described once: what IDispatch, ITypeInfo, the
// registration and a Windows build's check of its IDL all read.
#pragma once

#include <nqportmanager/NqPortManager.h>
#include <nqportmanager/typeinfo.h>

#include "automation/TypeDescription.h"

namespace automation {

const LibraryDesc& NqPortManagerLibrary();

// The module's one library object, for the module's lifetime (no reference is added).
ITypeLib* NqPortManagerTypeLib();

}  // namespace automation
