// Out-parameters of texts: a new BSTR that belongs to the caller.
#pragma once

#include <optional>
#include <string>

#include <nqportmanager/ComPtr.h>
#include <nqportmanager/com.h>

namespace portmanager {

// The COM error of a text that cannot be allocated: E_OUTOFMEMORY, with error info for the caller.
inline HRESULT RaiseOutOfMemory(REFIID iid) {
    ComPtr<ICreateErrorInfo> create;
    ComPtr<IErrorInfo> info;
    static OLECHAR kSource[] = OLESTR("NqPortManager.AdvancedPortManager");
    static OLECHAR kDescription[] = OLESTR("Out of memory");
    if (SUCCEEDED(CreateErrorInfo(create.GetAddressOf())) && SUCCEEDED(create->SetGUID(iid)) &&
        SUCCEEDED(create->SetSource(kSource)) && SUCCEEDED(create->SetDescription(kDescription)) &&
        SUCCEEDED(create->QueryInterface(IID_IErrorInfo, info.GetVoidAddressOf()))) {
        SetErrorInfo(0, info.Get());
    }
    return E_OUTOFMEMORY;
}

// E_POINTER for a null out-pointer; E_OUTOFMEMORY, raised as a COM error, when the copy cannot be
// made.
inline HRESULT CopyBstrOut(const std::string& text, BSTR* out) {
    if (out == nullptr) {
        return E_POINTER;
    }
    BSTR copy = BstrFromUtf8(text);
    if (copy == nullptr) {
        *out = nullptr;
        return RaiseOutOfMemory(IID_IAdvancedPortManager);
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
