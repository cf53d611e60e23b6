// Linux stand-in for oleaut32's VARIANT functions.
#include "nqportmanager/variant.h"

#include "nqportmanager/bstr.h"
#include "nqportmanager/safearray.h"
#include "platform/linux/com_internal.h"

namespace {

bool IsArrayElementType(VARTYPE vt) {
    switch (vt) {
        case VT_BSTR:
        case VT_I4:
        case VT_UI4:
        case VT_INT:
        case VT_UINT:
        case VT_I2:
        case VT_UI1:
        case VT_BOOL:
        case VT_VARIANT:
        case VT_UNKNOWN:
        case VT_DISPATCH:
            return true;
        default:
            return false;
    }
}

bool IsValidVartype(VARTYPE vt) {
    if ((vt & ~(VT_ARRAY | VT_BYREF | VT_TYPEMASK)) != 0) {
        return false;
    }
    const VARTYPE base = vt & VT_TYPEMASK;
    if ((vt & VT_ARRAY) != 0) {
        return IsArrayElementType(base);
    }
    if (base == VT_EMPTY || base == VT_NULL || base == VT_ERROR) {
        return (vt & VT_BYREF) == 0 || base == VT_ERROR;
    }
    if (base == VT_VARIANT) {
        return (vt & VT_BYREF) != 0;
    }
    return IsArrayElementType(base);
}

}  // namespace

void VariantInit(VARIANTARG* pvarg) {
    if (pvarg == nullptr) {
        return;
    }
    pvarg->vt = VT_EMPTY;
    pvarg->wReserved1 = 0;
    pvarg->wReserved2 = 0;
    pvarg->wReserved3 = 0;
}

HRESULT VariantClear(VARIANTARG* pvarg) {
    if (pvarg == nullptr) {
        return E_INVALIDARG;
    }
    const VARTYPE vt = pvarg->vt;
    if (!IsValidVartype(vt)) {
        return DISP_E_BADVARTYPE;
    }
    if ((vt & VT_BYREF) == 0) {
        if ((vt & VT_ARRAY) != 0) {
            const HRESULT hr = SafeArrayDestroy(pvarg->parray);
            if (FAILED(hr)) {
                return hr;
            }
        } else if (vt == VT_BSTR) {
            SysFreeString(pvarg->bstrVal);
        } else if (vt == VT_UNKNOWN) {
            if (pvarg->punkVal != nullptr) {
                pvarg->punkVal->Release();
            }
        } else if (vt == VT_DISPATCH) {
            if (pvarg->pdispVal != nullptr) {
                pvarg->pdispVal->Release();
            }
        }
    }
    pvarg->vt = VT_EMPTY;
    return S_OK;
}

HRESULT VariantCopy(VARIANTARG* pvargDest, const VARIANTARG* pvargSrc) {
    if (pvargDest == nullptr || pvargSrc == nullptr) {
        return E_INVALIDARG;
    }
    if (pvargDest == pvargSrc) {
        return S_OK;
    }
    const VARTYPE vt = pvargSrc->vt;
    if (!IsValidVartype(vt)) {
        return DISP_E_BADVARTYPE;
    }
    HRESULT hr = VariantClear(pvargDest);
    if (FAILED(hr)) {
        return hr;
    }
    VARIANT copy = *pvargSrc;
    if ((vt & VT_BYREF) == 0) {
        if ((vt & VT_ARRAY) != 0) {
            hr = SafeArrayCopy(pvargSrc->parray, &copy.parray);
            if (FAILED(hr)) {
                return hr;
            }
        } else if (vt == VT_BSTR) {
            copy.bstrVal = platform::CopyBstr(pvargSrc->bstrVal);
            if (pvargSrc->bstrVal != nullptr && copy.bstrVal == nullptr) {
                return E_OUTOFMEMORY;
            }
        } else if (vt == VT_UNKNOWN) {
            if (copy.punkVal != nullptr) {
                copy.punkVal->AddRef();
            }
        } else if (vt == VT_DISPATCH) {
            if (copy.pdispVal != nullptr) {
                copy.pdispVal->AddRef();
            }
        }
    }
    *pvargDest = copy;
    return S_OK;
}
