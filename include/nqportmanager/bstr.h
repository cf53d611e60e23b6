// BSTR: allocation as oleaut32 provides it, UTF-8 conversion and the BStr owner.
#pragma once

#include <nqportmanager/comtypes.h>

#include <string>
#include <string_view>
#include <utility>

#ifndef _WIN32
// Layout as on Windows: a 4-byte byte count right before the first character, then the
// characters, then a 2-byte zero. Storage comes from malloc, so failure is a null, not a throw.
extern "C" {
NQ_MODULE_EXPORT BSTR SysAllocString(const OLECHAR* psz);
NQ_MODULE_EXPORT BSTR SysAllocStringLen(const OLECHAR* strIn, UINT ui);
NQ_MODULE_EXPORT BSTR SysAllocStringByteLen(const char* psz, UINT len);
NQ_MODULE_EXPORT INT SysReAllocString(BSTR* pbstr, const OLECHAR* psz);
NQ_MODULE_EXPORT INT SysReAllocStringLen(BSTR* pbstr, const OLECHAR* psz, UINT len);
NQ_MODULE_EXPORT void SysFreeString(BSTR bstrString);
NQ_MODULE_EXPORT UINT SysStringLen(BSTR pbstr);
NQ_MODULE_EXPORT UINT SysStringByteLen(BSTR bstr);
}  // extern "C"
#endif  // _WIN32

// UTF-8 helpers (not part of Windows). Malformed input becomes U+FFFD.
BSTR BstrFromUtf8(std::string_view utf8);
std::string Utf8FromBstr(BSTR bstr);
std::u16string_view BstrView(BSTR bstr);

// Owns one BSTR, in the manner of ATL's CComBSTR.
class BStr {
  public:
    BStr() noexcept = default;
    BStr(std::string_view utf8) noexcept : str_(BstrFromUtf8(utf8)) {}
    explicit BStr(const OLECHAR* psz) noexcept : str_(SysAllocString(psz)) {}
    BStr(BStr&& other) noexcept : str_(std::exchange(other.str_, nullptr)) {}
    BStr& operator=(BStr&& other) noexcept {
        if (this != &other) {
            SysFreeString(str_);
            str_ = std::exchange(other.str_, nullptr);
        }
        return *this;
    }
    BStr(const BStr&) = delete;
    BStr& operator=(const BStr&) = delete;
    ~BStr() { SysFreeString(str_); }

    static BStr Attach(BSTR bstr) noexcept {
        BStr owner;
        owner.str_ = bstr;
        return owner;
    }
    BSTR Get() const noexcept { return str_; }
    BSTR Detach() noexcept { return std::exchange(str_, nullptr); }
    // For out parameters: the previous string is freed first.
    BSTR* Out() noexcept {
        SysFreeString(std::exchange(str_, nullptr));
        return &str_;
    }
    BSTR Copy() const noexcept {
        return str_ == nullptr ? nullptr : SysAllocStringLen(str_, SysStringLen(str_));
    }
    bool IsNull() const noexcept { return str_ == nullptr; }
    std::string Utf8() const { return Utf8FromBstr(str_); }
    UINT Length() const noexcept { return SysStringLen(str_); }

  private:
    BSTR str_ = nullptr;
};

#include <nqportmanager/bstr_utf8.h>
