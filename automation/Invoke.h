// ITypeInfo::Invoke over a described interface: DISPPARAMS to the vtable member and back.
#pragma once

#include "automation/TypeDescription.h"

namespace automation {

// The type named name in the library, with its index; null when there is none.
const TypeDesc* FindType(const LibraryDesc& library, const char* name, size_t* index = nullptr);

// Calls the member memid of the interface type on instance (a pointer to that interface):
// arguments in reverse order, DISPID_PROPERTYPUT named for a put, parameter names (their
// positions as DISPIDs) for the rest; each argument changed to its parameter's type as
// VariantChangeType does (a VARIANT parameter takes it as it is). Codes: E_POINTER for null
// params, E_INVALIDARG for an inconsistent DISPPARAMS, flags or instance; DISP_E_MEMBERNOTFOUND
// for an unknown memid or a kind it lacks; DISP_E_PARAMNOTFOUND for a missing or unknown named
// argument; DISP_E_BADPARAMCOUNT; DISP_E_PARAMNOTOPTIONAL for a missing (VT_ERROR
// DISP_E_PARAMNOTFOUND) argument; DISP_E_TYPEMISMATCH or DISP_E_OVERFLOW for an argument that
// cannot be changed; these set *argErr to its index in rgvarg. A failing member gives
// DISP_E_EXCEPTION, with its code and error info in *excepInfo.
HRESULT InvokeMember(const LibraryDesc& library, const TypeDesc& type, void* instance,
                     MEMBERID memid, WORD flags, DISPPARAMS* params, VARIANT* result,
                     EXCEPINFO* excepInfo, UINT* argErr);

// The VARTYPE a value of this type travels in (an enumeration as VT_I4, an interface as
// VT_DISPATCH when it is dual, else VT_UNKNOWN).
VARTYPE ValueVartype(const LibraryDesc& library, const TypeRef& type);

}  // namespace automation
