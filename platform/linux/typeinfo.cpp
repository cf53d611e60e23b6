#include "platform/typeinfo.h"

namespace platform {

ITypeInfo* DispatchTypeInfo(REFGUID, REFIID) {
    return nullptr;
}

HRESULT DispatchGetTypeInfo(ITypeInfo*, UINT, ITypeInfo** out) {
    if (out != nullptr) {
        *out = nullptr;
    }
    return TYPE_E_ELEMENTNOTFOUND;
}

HRESULT DispatchGetIDsOfNames(ITypeInfo*, LPOLESTR*, UINT, DISPID*) {
    return DISP_E_UNKNOWNNAME;
}

HRESULT DispatchInvoke(void*, ITypeInfo*, DISPID, WORD, DISPPARAMS*, VARIANT*, EXCEPINFO*, UINT*) {
    return DISP_E_MEMBERNOTFOUND;
}

}  // namespace platform
