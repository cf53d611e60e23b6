// Out-parameters of texts: a new BSTR that belongs to the caller.
#pragma once

#include <optional>
#include <string>

#include <nqportmanager/com.h>

namespace portmanager {

// E_POINTER for a null out-pointer; E_OUTOFMEMORY when the copy cannot be made (COM raises it
// as an error; across this interface it is the result).
inline HRESULT CopyBstrOut(const std::string& text, BSTR* out) {
    if (out == nullptr) {
        return E_POINTER;
    }
    BSTR copy = BstrFromUtf8(text);
    if (copy == nullptr) {
        *out = nullptr;
        return E_OUTOFMEMORY;
    }
    *out = copy;
    return S_OK;
}

// A text that was never set gives a null BSTR.
inline HRESULT CopyBstrOut(const std::optional<std::string>& text, BSTR* out) {
    if (out == nullptr) {
        return E_POINTER;
    }
    if (!text.has_value()) {
        *out = nullptr;
        return S_OK;
    }
    return CopyBstrOut(*text, out);
}

}  // namespace portmanager
