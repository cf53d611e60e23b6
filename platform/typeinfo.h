// Type information for IDispatch: where the platform has type libraries (oleaut32), the dual
// interfaces of the module serve IDispatch from it; elsewhere there is none, and callers use the
// vtable.
#pragma once

#include "platform/system_names.h"

#include <nqportmanager/com.h>

namespace platform {

// The type information of interface iid in library libid 1.0: the registered library first,
// else the one embedded in this module's file. Borrowed: it lives as long as the module. Null
// where there is none.
ITypeInfo* DispatchTypeInfo(REFGUID libid, REFIID iid);

// IDispatch::GetTypeInfo: a new reference to info for index 0; TYPE_E_ELEMENTNOTFOUND (and a
// null *out) without it.
HRESULT DispatchGetTypeInfo(ITypeInfo* info, UINT index, ITypeInfo** out);

// DispGetIDsOfNames and DispInvoke over that information; DISP_E_UNKNOWNNAME and
// DISP_E_MEMBERNOTFOUND without it.
HRESULT DispatchGetIDsOfNames(ITypeInfo* info, LPOLESTR* names, UINT count, DISPID* ids);
HRESULT DispatchInvoke(void* object, ITypeInfo* info, DISPID member, WORD flags, DISPPARAMS* params,
                       VARIANT* result, EXCEPINFO* exception, UINT* argError);

}  // namespace platform
