// Linux stand-in for oleaut32's VARIANT functions.
#include "nqportmanager/variant.h"

#include <cstdint>
#include <string>
#include <string_view>

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

namespace {

bool IsInteger(VARTYPE vt) {
    return vt == VT_I2 || vt == VT_I4 || vt == VT_INT || vt == VT_UI1 || vt == VT_UI4 ||
           vt == VT_UINT;
}

int64_t IntegerOf(const VARIANT& v) {
    switch (v.vt) {
        case VT_I2:
            return v.iVal;
        case VT_I4:
            return v.lVal;
        case VT_INT:
            return v.intVal;
        case VT_UI1:
            return v.bVal;
        case VT_UI4:
            return v.ulVal;
        default:
            return v.uintVal;
    }
}

HRESULT StoreInteger(int64_t value, VARTYPE vt, VARIANT& out) {
    int64_t low = 0;
    int64_t high = 0;
    switch (vt) {
        case VT_I2:
            low = INT16_MIN, high = INT16_MAX;
            break;
        case VT_I4:
        case VT_INT:
            low = INT32_MIN, high = INT32_MAX;
            break;
        case VT_UI1:
            high = UINT8_MAX;
            break;
        default:
            high = UINT32_MAX;
            break;
    }
    if (value < low || value > high) {
        return DISP_E_OVERFLOW;
    }
    out.vt = vt;
    switch (vt) {
        case VT_I2:
            out.iVal = static_cast<SHORT>(value);
            break;
        case VT_I4:
            out.lVal = static_cast<LONG>(value);
            break;
        case VT_INT:
            out.intVal = static_cast<INT>(value);
            break;
        case VT_UI1:
            out.bVal = static_cast<BYTE>(value);
            break;
        case VT_UI4:
            out.ulVal = static_cast<ULONG>(value);
            break;
        default:
            out.uintVal = static_cast<UINT>(value);
            break;
    }
    return S_OK;
}

bool EqualsIgnoringCase(std::u16string_view text, std::u16string_view word) {
    if (text.size() != word.size()) {
        return false;
    }
    for (size_t i = 0; i < text.size(); ++i) {
        const char16_t a = text[i] >= u'A' && text[i] <= u'Z' ? text[i] + 32 : text[i];
        if (a != word[i]) {
            return false;
        }
    }
    return true;
}

// A decimal integer with optional sign and surrounding blanks; an embedded NUL is no blank.
HRESULT ParseInteger(std::u16string_view text, int64_t& value) {
    size_t i = 0;
    while (i < text.size() && (text[i] == u' ' || text[i] == u'\t')) {
        ++i;
    }
    bool negative = false;
    if (i < text.size() && (text[i] == u'-' || text[i] == u'+')) {
        negative = text[i++] == u'-';
    }
    const size_t digits = i;
    uint64_t magnitude = 0;
    bool overflow = false;
    for (; i < text.size() && text[i] >= u'0' && text[i] <= u'9'; ++i) {
        magnitude = magnitude * 10 + static_cast<uint64_t>(text[i] - u'0');
        overflow = overflow || magnitude > (uint64_t{1} << 40);
    }
    const bool any = i > digits;
    while (i < text.size() && (text[i] == u' ' || text[i] == u'\t')) {
        ++i;
    }
    if (!any || i != text.size()) {
        return DISP_E_TYPEMISMATCH;
    }
    if (overflow) {
        return DISP_E_OVERFLOW;
    }
    value = negative ? -static_cast<int64_t>(magnitude) : static_cast<int64_t>(magnitude);
    return S_OK;
}

HRESULT ChangeBasicType(const VARIANT& src, USHORT flags, VARTYPE vt, VARIANT& out) {
    if (src.vt == VT_NULL || src.vt == VT_ERROR || (src.vt & VT_ARRAY) != 0) {
        return DISP_E_TYPEMISMATCH;
    }
    if (vt == VT_UNKNOWN || vt == VT_DISPATCH) {
        if (src.vt != VT_UNKNOWN && src.vt != VT_DISPATCH) {
            return DISP_E_TYPEMISMATCH;
        }
        out.vt = vt;
        out.punkVal = nullptr;
        if (src.punkVal == nullptr) {
            return S_OK;
        }
        return FAILED(src.punkVal->QueryInterface(vt == VT_UNKNOWN ? IID_IUnknown : IID_IDispatch,
                                                  reinterpret_cast<void**>(&out.punkVal)))
                   ? DISP_E_TYPEMISMATCH
                   : S_OK;
    }
    if (src.vt == VT_UNKNOWN || src.vt == VT_DISPATCH) {
        return DISP_E_TYPEMISMATCH;
    }
    // The source as a number (VT_EMPTY is zero, VT_BOOL -1 or 0), or as text.
    int64_t number = 0;
    std::u16string_view text;
    const bool isText = src.vt == VT_BSTR;
    if (isText) {
        text = BstrView(src.bstrVal);
    } else if (src.vt == VT_BOOL) {
        number = src.boolVal != VARIANT_FALSE ? -1 : 0;
    } else if (IsInteger(src.vt)) {
        number = IntegerOf(src);
    } else if (src.vt != VT_EMPTY) {
        return DISP_E_TYPEMISMATCH;
    }
    if (vt == VT_BSTR) {
        std::string digits;
        if (isText) {
            out.bstrVal = platform::CopyBstr(src.bstrVal);
        } else {
            digits = src.vt == VT_EMPTY ? std::string()
                     : src.vt == VT_BOOL && (flags & VARIANT_ALPHABOOL) != 0
                         ? std::string(number != 0 ? "True" : "False")
                         : std::to_string(number);
            out.bstrVal = BstrFromUtf8(digits);
        }
        if (out.bstrVal == nullptr && !(isText && src.bstrVal == nullptr)) {
            return E_OUTOFMEMORY;
        }
        out.vt = VT_BSTR;
        return S_OK;
    }
    if (vt == VT_BOOL) {
        if (isText) {
            if (EqualsIgnoringCase(text, u"true")) {
                number = 1;
            } else if (!EqualsIgnoringCase(text, u"false")) {
                const HRESULT hr = ParseInteger(text, number);
                if (hr == DISP_E_OVERFLOW) {
                    number = 1;  // too large for any integer, but surely not zero
                } else if (FAILED(hr)) {
                    return hr;
                }
            }
        }
        out.vt = VT_BOOL;
        out.boolVal = number != 0 ? VARIANT_TRUE : VARIANT_FALSE;
        return S_OK;
    }
    if (!IsInteger(vt)) {
        return DISP_E_TYPEMISMATCH;
    }
    if (isText) {
        const HRESULT hr = ParseInteger(text, number);
        if (FAILED(hr)) {
            return hr;
        }
    }
    return StoreInteger(number, vt, out);
}

}  // namespace

HRESULT VariantChangeType(VARIANTARG* pvargDest, const VARIANTARG* pvarSrc, USHORT wFlags,
                          VARTYPE vt) {
    if (pvargDest == nullptr || pvarSrc == nullptr) {
        return E_INVALIDARG;
    }
    if (!IsValidVartype(pvarSrc->vt) || (vt & (VT_BYREF | VT_ARRAY)) != 0) {
        return DISP_E_BADVARTYPE;
    }
    VARIANT src = *pvarSrc;
    if ((src.vt & VT_BYREF) != 0) {
        const VARTYPE base = src.vt & VT_TYPEMASK;
        if (src.byref == nullptr) {
            return E_INVALIDARG;
        }
        if ((src.vt & VT_ARRAY) != 0) {
            return DISP_E_TYPEMISMATCH;
        }
        if (base == VT_VARIANT) {
            // One level only, as on Windows: a reference to a reference is no valid VARIANT.
            const auto* inner = static_cast<const VARIANT*>(src.byref);
            if (inner->vt == (VT_BYREF | VT_VARIANT)) {
                return DISP_E_BADVARTYPE;
            }
            return VariantChangeType(pvargDest, inner, wFlags, vt);
        }
        VARIANT deref;
        VariantInit(&deref);
        deref.vt = base;
        switch (base) {
            case VT_I2:
                deref.iVal = *static_cast<SHORT*>(src.byref);
                break;
            case VT_UI1:
                deref.bVal = *static_cast<BYTE*>(src.byref);
                break;
            case VT_BOOL:
                deref.boolVal = *static_cast<VARIANT_BOOL*>(src.byref);
                break;
            case VT_BSTR:
                deref.bstrVal = *static_cast<BSTR*>(src.byref);
                break;
            case VT_UNKNOWN:
            case VT_DISPATCH:
                deref.punkVal = *static_cast<IUnknown**>(src.byref);
                break;
            case VT_ERROR:
                deref.scode = *static_cast<SCODE*>(src.byref);
                break;
            default:  // the 32-bit integers
                deref.lVal = *static_cast<LONG*>(src.byref);
                break;
        }
        src = deref;
    }
    VARIANT out;
    VariantInit(&out);
    HRESULT hr = S_OK;
    if (vt == src.vt) {
        hr = VariantCopy(&out, &src);
    } else if (vt == VT_EMPTY || vt == VT_NULL) {
        hr = src.vt == vt || src.vt == VT_EMPTY ? S_OK : DISP_E_TYPEMISMATCH;
        out.vt = vt;
    } else {
        hr = ChangeBasicType(src, wFlags, vt, out);
    }
    if (FAILED(hr)) {
        VariantClear(&out);
        return hr;
    }
    // Cleared only now: the source may be the destination.
    hr = VariantClear(pvargDest);
    if (FAILED(hr)) {
        VariantClear(&out);
        return hr;
    }
    *pvargDest = out;
    return S_OK;
}
