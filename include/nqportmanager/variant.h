// VARIANT and the functions that initialise, clear and copy it.
#pragma once

#include <nqportmanager/cominterfaces.h>
#include <nqportmanager/comtypes.h>

#ifndef _WIN32
struct SAFEARRAY;

enum VARENUM {
    VT_EMPTY = 0,
    VT_NULL = 1,
    VT_I2 = 2,
    VT_I4 = 3,
    VT_BSTR = 8,
    VT_DISPATCH = 9,
    VT_ERROR = 10,
    VT_BOOL = 11,
    VT_VARIANT = 12,
    VT_UNKNOWN = 13,
    VT_UI1 = 17,
    VT_UI4 = 19,
    VT_INT = 22,
    VT_UINT = 23,
    VT_VOID = 24,
    VT_HRESULT = 25,
    VT_PTR = 26,
    VT_USERDEFINED = 29,
    VT_ARRAY = 0x2000,
    VT_BYREF = 0x4000,
    VT_TYPEMASK = 0x0FFF,
};

// VariantChangeType: VT_BOOL to VT_BSTR as "True"/"False" instead of "-1"/"0".
inline constexpr USHORT VARIANT_ALPHABOOL = 0x2;

struct VARIANT {
    VARTYPE vt;
    WORD wReserved1;
    WORD wReserved2;
    WORD wReserved3;
    union {
        LONG lVal;
        BYTE bVal;
        SHORT iVal;
        ULONG ulVal;
        INT intVal;
        UINT uintVal;
        VARIANT_BOOL boolVal;
        SCODE scode;
        BSTR bstrVal;
        IUnknown* punkVal;
        IDispatch* pdispVal;
        SAFEARRAY* parray;
        VARIANT* pvarVal;
        void* byref;
    };
};
typedef VARIANT VARIANTARG;

#define V_VT(X) ((X)->vt)
#define V_I2(X) ((X)->iVal)
#define V_I4(X) ((X)->lVal)
#define V_UI1(X) ((X)->bVal)
#define V_UI4(X) ((X)->ulVal)
#define V_INT(X) ((X)->intVal)
#define V_UINT(X) ((X)->uintVal)
#define V_BOOL(X) ((X)->boolVal)
#define V_ERROR(X) ((X)->scode)
#define V_BSTR(X) ((X)->bstrVal)
#define V_UNKNOWN(X) ((X)->punkVal)
#define V_DISPATCH(X) ((X)->pdispVal)
#define V_ARRAY(X) ((X)->parray)
#define V_VARIANTREF(X) ((X)->pvarVal)
#define V_BYREF(X) ((X)->byref)

extern "C" {
NQ_MODULE_EXPORT void VariantInit(VARIANTARG* pvarg);
NQ_MODULE_EXPORT HRESULT VariantClear(VARIANTARG* pvarg);
NQ_MODULE_EXPORT HRESULT VariantCopy(VARIANTARG* pvargDest, const VARIANTARG* pvargSrc);
// Conversion among VT_EMPTY, the integer types, VT_BOOL, VT_BSTR (decimal integers, "True" and
// "False"), VT_UNKNOWN and VT_DISPATCH (by QueryInterface), through VT_BYREF too. Numbers out of
// the target's range give DISP_E_OVERFLOW, anything else that cannot be converted
// DISP_E_TYPEMISMATCH. pvargDest may be pvarSrc; it is changed only on success.
NQ_MODULE_EXPORT HRESULT VariantChangeType(VARIANTARG* pvargDest, const VARIANTARG* pvarSrc,
                                           USHORT wFlags, VARTYPE vt);
}  // extern "C"
#endif  // _WIN32
