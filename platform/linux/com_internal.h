// Shared by the Linux stand-ins for oleaut32; not part of the public COM headers.
#pragma once

#include <nqportmanager/comtypes.h>

namespace platform {

// Byte-exact copy, so odd byte lengths from SysAllocStringByteLen survive.
BSTR CopyBstr(BSTR src);

}  // namespace platform
