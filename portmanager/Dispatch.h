// IDispatch of the module's dual interfaces: served from the type library where the platform has
// one (oleaut32 on Windows); elsewhere there is no type information and callers use the vtable,
// so late-bound calls fail cleanly instead of reaching a member by accident.
#pragma once

#include <nqportmanager/ComPtr.h>
#include <nqportmanager/NqPortManager.h>
#include <nqportmanager/com.h>

#include "platform/typeinfo.h"

namespace portmanager {

template <typename Base>
class NoTypeInfoDispatch : public Base {
  public:
    HRESULT GetTypeInfoCount(UINT* pctinfo) override {
        if (pctinfo == nullptr) {
            return E_POINTER;
        }
        *pctinfo = Info() != nullptr ? 1 : 0;
        return S_OK;
    }
    HRESULT GetTypeInfo(UINT index, LCID, ITypeInfo** ppTInfo) override {
        return platform::DispatchGetTypeInfo(Info(), index, ppTInfo);
    }
    HRESULT GetIDsOfNames(REFIID, LPOLESTR* names, UINT count, LCID, DISPID* ids) override {
        return platform::DispatchGetIDsOfNames(Info(), names, count, ids);
    }
    HRESULT Invoke(DISPID member, REFIID, LCID, WORD flags, DISPPARAMS* params, VARIANT* result,
                   EXCEPINFO* exception, UINT* argError) override {
        return platform::DispatchInvoke(static_cast<Base*>(this), Info(), member, flags, params,
                                        result, exception, argError);
    }

  private:
    static ITypeInfo* Info() {
        return platform::DispatchTypeInfo(LIBID_NqPortManagerLib, *ComIidOf<Base>);
    }
};

}  // namespace portmanager
