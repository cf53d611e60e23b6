// The per-thread error info, as oleaut32 keeps it: a method that fails may leave a description
// for its caller, who takes it with GetErrorInfo.
#pragma once

#include <nqportmanager/bstr.h>
#include <nqportmanager/cominterfaces.h>

#ifndef _WIN32
inline constexpr IID IID_IErrorInfo = MakeGuid("1CF2B120-547D-101B-8E65-08002B2BD119");
inline constexpr IID IID_ICreateErrorInfo = MakeGuid("22F03340-547D-101B-8E65-08002B2BD119");

struct IErrorInfo : public IUnknown {
    virtual HRESULT GetGUID(GUID* pGUID) = 0;
    virtual HRESULT GetSource(BSTR* pBstrSource) = 0;
    virtual HRESULT GetDescription(BSTR* pBstrDescription) = 0;
    virtual HRESULT GetHelpFile(BSTR* pBstrHelpFile) = 0;
    virtual HRESULT GetHelpContext(DWORD* pdwHelpContext) = 0;

  protected:
    ~IErrorInfo() = default;
};

struct ICreateErrorInfo : public IUnknown {
    virtual HRESULT SetGUID(REFGUID rguid) = 0;
    virtual HRESULT SetSource(LPOLESTR szSource) = 0;
    virtual HRESULT SetDescription(LPOLESTR szDescription) = 0;
    virtual HRESULT SetHelpFile(LPOLESTR szHelpFile) = 0;
    virtual HRESULT SetHelpContext(DWORD dwHelpContext) = 0;

  protected:
    ~ICreateErrorInfo() = default;
};

extern "C" {
NQ_MODULE_EXPORT HRESULT CreateErrorInfo(ICreateErrorInfo** pperrinfo);
// Replaces the calling thread's error info (null clears it).
NQ_MODULE_EXPORT HRESULT SetErrorInfo(ULONG dwReserved, IErrorInfo* perrinfo);
// Hands the calling thread's error info over and clears it; S_FALSE and null when there is none.
NQ_MODULE_EXPORT HRESULT GetErrorInfo(ULONG dwReserved, IErrorInfo** pperrinfo);
}  // extern "C"
#endif  // _WIN32
