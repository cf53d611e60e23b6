// IDispatch of a dual interface, served from the type information of the library that the
// object is given (the module gives its own). Without one, as for objects made outside the
// module, the interface shows no members and late-bound calls fail cleanly.
#pragma once

#include <nqportmanager/ComPtr.h>
#include <nqportmanager/com.h>
#include <nqportmanager/typeinfo.h>

namespace portmanager {

// The library is locale neutral: every locale whose reserved bits are clear is served alike.
constexpr bool IsKnownLcid(LCID lcid) {
    return (lcid & 0xFFF00000u) == 0;
}

template <typename Base>
class TypeInfoDispatch : public Base {
  public:
    HRESULT GetTypeInfoCount(UINT* pctinfo) override {
        if (pctinfo == nullptr) {
            return E_POINTER;
        }
        *pctinfo = m_typeInfo ? 1 : 0;
        return S_OK;
    }
    HRESULT GetTypeInfo(UINT iTInfo, LCID lcid, ITypeInfo** ppTInfo) override {
        if (ppTInfo == nullptr) {
            return E_POINTER;
        }
        *ppTInfo = nullptr;
        if (iTInfo != 0 || !m_typeInfo) {
            return DISP_E_BADINDEX;
        }
        if (!IsKnownLcid(lcid)) {
            return DISP_E_UNKNOWNLCID;
        }
        return m_typeInfo.CopyTo(ppTInfo);
    }
    HRESULT GetIDsOfNames(REFIID riid, LPOLESTR* rgszNames, UINT cNames, LCID lcid,
                          DISPID* rgDispId) override {
        if (rgszNames == nullptr || rgDispId == nullptr) {
            return E_POINTER;
        }
        if (riid != GUID_NULL) {
            return DISP_E_UNKNOWNINTERFACE;
        }
        if (!IsKnownLcid(lcid)) {
            return DISP_E_UNKNOWNLCID;
        }
        if (!m_typeInfo) {
            for (UINT i = 0; i < cNames; ++i) {
                rgDispId[i] = DISPID_UNKNOWN;
            }
            return DISP_E_UNKNOWNNAME;
        }
        return m_typeInfo->GetIDsOfNames(rgszNames, cNames, rgDispId);
    }
    HRESULT Invoke(DISPID dispIdMember, REFIID riid, LCID lcid, WORD wFlags,
                   DISPPARAMS* pDispParams, VARIANT* pVarResult, EXCEPINFO* pExcepInfo,
                   UINT* puArgErr) override {
        if (riid != GUID_NULL) {
            return DISP_E_UNKNOWNINTERFACE;
        }
        if (!IsKnownLcid(lcid)) {
            return DISP_E_UNKNOWNLCID;
        }
        if (!m_typeInfo) {
            return DISP_E_MEMBERNOTFOUND;
        }
        return m_typeInfo->Invoke(static_cast<Base*>(this), dispIdMember, wFlags, pDispParams,
                                  pVarResult, pExcepInfo, puArgErr);
    }

  protected:
    void UseTypeLibrary(ITypeLib* library) {
        m_typeInfo.Reset();
        if (library != nullptr) {
            library->GetTypeInfoOfGuid(*ComIidOf<Base>, m_typeInfo.GetAddressOf());
        }
    }

  private:
    ComPtr<ITypeInfo> m_typeInfo;
};

}  // namespace portmanager
