// The error info object and the per-thread slot. Portable: the Windows build uses oleaut32's.
#include <atomic>
#include <new>

#include <nqportmanager/ComPtr.h>
#include <nqportmanager/errorinfo.h>

#include "platform/linux/threadslot.h"
#include "platform/modulelock.h"

namespace {

class ErrorInfo final : public IErrorInfo, public ICreateErrorInfo {
  public:
    HRESULT QueryInterface(REFIID riid, void** ppv) override {
        if (ppv == nullptr) {
            return E_POINTER;
        }
        if (riid == IID_IUnknown || riid == IID_IErrorInfo) {
            *ppv = static_cast<IErrorInfo*>(this);
        } else if (riid == IID_ICreateErrorInfo) {
            *ppv = static_cast<ICreateErrorInfo*>(this);
        } else {
            *ppv = nullptr;
            return E_NOINTERFACE;
        }
        AddRef();
        return S_OK;
    }
    ULONG AddRef() override { return ++m_refs; }
    ULONG Release() override {
        const ULONG left = --m_refs;
        if (left == 0) {
            delete this;
        }
        return left;
    }

    HRESULT GetGUID(GUID* pGUID) override {
        if (pGUID == nullptr) {
            return E_POINTER;
        }
        *pGUID = m_guid;
        return S_OK;
    }
    HRESULT GetSource(BSTR* out) override { return Copy(m_source, out); }
    HRESULT GetDescription(BSTR* out) override { return Copy(m_description, out); }
    HRESULT GetHelpFile(BSTR* out) override { return Copy(m_helpFile, out); }
    HRESULT GetHelpContext(DWORD* out) override {
        if (out == nullptr) {
            return E_POINTER;
        }
        *out = m_helpContext;
        return S_OK;
    }

    HRESULT SetGUID(REFGUID guid) override {
        m_guid = guid;
        return S_OK;
    }
    HRESULT SetSource(LPOLESTR text) override { return Set(m_source, text); }
    HRESULT SetDescription(LPOLESTR text) override { return Set(m_description, text); }
    HRESULT SetHelpFile(LPOLESTR text) override { return Set(m_helpFile, text); }
    HRESULT SetHelpContext(DWORD context) override {
        m_helpContext = context;
        return S_OK;
    }

  private:
    ~ErrorInfo() = default;

    static HRESULT Copy(const BStr& text, BSTR* out) {
        if (out == nullptr) {
            return E_POINTER;
        }
        *out = text.Copy();
        return *out != nullptr || text.IsNull() ? S_OK : E_OUTOFMEMORY;
    }
    static HRESULT Set(BStr& text, LPOLESTR value) {
        BStr copy(value);
        if (value != nullptr && copy.IsNull()) {
            return E_OUTOFMEMORY;
        }
        text = std::move(copy);
        return S_OK;
    }

    std::atomic<ULONG> m_refs{0};
    GUID m_guid{};
    BStr m_source;
    BStr m_description;
    BStr m_helpFile;
    DWORD m_helpContext = 0;
    platform::ModuleReference m_moduleLock;  // its code lives in the module
};

// Not a thread_local, so that the module can unload.
platform::ThreadSlot<ComPtr<IErrorInfo>> g_errorInfo;

}  // namespace

extern "C" {

HRESULT CreateErrorInfo(ICreateErrorInfo** pperrinfo) {
    if (pperrinfo == nullptr) {
        return E_POINTER;
    }
    auto* info = new (std::nothrow) ErrorInfo();
    *pperrinfo = info;
    if (info == nullptr) {
        return E_OUTOFMEMORY;
    }
    info->AddRef();
    return S_OK;
}

HRESULT SetErrorInfo(ULONG, IErrorInfo* perrinfo) {
    ComPtr<IErrorInfo>* slot = g_errorInfo.Get();
    if (slot == nullptr) {
        return E_OUTOFMEMORY;
    }
    *slot = ComPtr<IErrorInfo>(perrinfo);
    return S_OK;
}

HRESULT GetErrorInfo(ULONG, IErrorInfo** pperrinfo) {
    if (pperrinfo == nullptr) {
        return E_POINTER;
    }
    ComPtr<IErrorInfo>* slot = g_errorInfo.Get();
    *pperrinfo = slot != nullptr ? slot->Detach() : nullptr;
    return *pperrinfo != nullptr ? S_OK : S_FALSE;
}

}  // extern "C"
