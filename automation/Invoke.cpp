#include "automation/Invoke.h"

#include <nqportmanager/errorinfo.h>

#include <vector>

namespace automation {

namespace {

const MemberDesc* FindMember(const TypeDesc& type, MEMBERID memid, WORD flags) {
    const MemberDesc* func = nullptr;
    const MemberDesc* get = nullptr;
    const MemberDesc* put = nullptr;
    for (const MemberDesc& m : type.members) {
        if (m.dispid == memid) {
            (m.kind == INVOKE_FUNC ? func : m.kind == INVOKE_PROPERTYGET ? get : put) = &m;
        }
    }
    if ((flags & DISPATCH_PROPERTYPUT) != 0) {
        return put;
    }
    if ((flags & DISPATCH_PROPERTYGET) != 0 && get != nullptr) {
        return get;
    }
    return (flags & DISPATCH_METHOD) != 0 ? func : nullptr;
}

// One argument changed to its parameter's type, and what must be freed after the call.
struct Converted {
    VARIANT value;
    bool ownsBstr = false;
    bool ownsInterface = false;
};

HRESULT Convert(const LibraryDesc& library, const TypeRef& type, const VARIANT& source,
                Converted& out) {
    VariantInit(&out.value);
    if (source.vt == VT_ERROR && source.scode == DISP_E_PARAMNOTFOUND) {
        return DISP_E_PARAMNOTOPTIONAL;
    }
    if (type.vt == VT_VARIANT) {
        out.value = source;  // the caller's, taken as it is
        return S_OK;
    }
    const TypeDesc* named = type.vt == VT_USERDEFINED ? FindType(library, type.userType) : nullptr;
    if (type.vt == VT_USERDEFINED && named == nullptr) {
        return DISP_E_TYPEMISMATCH;
    }
    if (named == nullptr || named->kind == TKIND_ENUM) {
        const VARTYPE vt = named != nullptr ? VARTYPE{VT_I4} : type.vt;
        const HRESULT hr = VariantChangeType(&out.value, &source, 0, vt);
        out.ownsBstr = SUCCEEDED(hr) && vt == VT_BSTR;
        return FAILED(hr) && hr != E_OUTOFMEMORY && hr != DISP_E_OVERFLOW ? DISP_E_TYPEMISMATCH
                                                                          : hr;
    }
    // An interface: a null pointer passes, anything else must answer the interface.
    VARIANT object;
    VariantInit(&object);
    if (FAILED(VariantChangeType(&object, &source, 0, VT_UNKNOWN))) {
        return DISP_E_TYPEMISMATCH;
    }
    if (object.punkVal == nullptr) {
        out.value.byref = nullptr;
        return S_OK;
    }
    const HRESULT hr = object.punkVal->QueryInterface(*named->guid, &out.value.byref);
    VariantClear(&object);
    if (FAILED(hr)) {
        return DISP_E_TYPEMISMATCH;
    }
    out.ownsInterface = true;
    return S_OK;
}

void Release(std::vector<Converted>& args) {
    for (Converted& a : args) {
        if (a.ownsBstr) {
            VariantClear(&a.value);
        } else if (a.ownsInterface && a.value.byref != nullptr) {
            static_cast<IUnknown*>(a.value.byref)->Release();
        }
    }
}

void FillException(HRESULT failure, EXCEPINFO* info) {
    ComPtr<IErrorInfo> error;
    const bool hasError = GetErrorInfo(0, error.GetAddressOf()) == S_OK && error;
    if (info == nullptr) {
        return;
    }
    *info = EXCEPINFO{};
    info->scode = failure;
    if (hasError) {
        error->GetSource(&info->bstrSource);
        error->GetDescription(&info->bstrDescription);
        error->GetHelpFile(&info->bstrHelpFile);
        error->GetHelpContext(&info->dwHelpContext);
    }
}

}  // namespace

const TypeDesc* FindType(const LibraryDesc& library, const char* name, size_t* index) {
    for (size_t i = 0; i < library.types.size(); ++i) {
        if (SameText(library.types[i].name, name)) {
            if (index != nullptr) {
                *index = i;
            }
            return &library.types[i];
        }
    }
    return nullptr;
}

VARTYPE ValueVartype(const LibraryDesc& library, const TypeRef& type) {
    if (type.vt != VT_USERDEFINED) {
        return type.vt;
    }
    const TypeDesc* named = FindType(library, type.userType);
    if (named == nullptr || named->kind == TKIND_ENUM) {
        return VT_I4;
    }
    return (named->flags & TYPEFLAG_FDUAL) != 0 ? VARTYPE{VT_DISPATCH} : VARTYPE{VT_UNKNOWN};
}

HRESULT InvokeMember(const LibraryDesc& library, const TypeDesc& type, void* instance,
                     MEMBERID memid, WORD flags, DISPPARAMS* params, VARIANT* result,
                     EXCEPINFO* excepInfo, UINT* argErr) {
    constexpr WORD kKinds =
        DISPATCH_METHOD | DISPATCH_PROPERTYGET | DISPATCH_PROPERTYPUT | DISPATCH_PROPERTYPUTREF;
    if (params == nullptr) {
        return E_POINTER;
    }
    if (instance == nullptr || flags == 0 || (flags & ~kKinds) != 0 ||
        params->cNamedArgs > params->cArgs || (params->cArgs > 0 && params->rgvarg == nullptr) ||
        (params->cNamedArgs > 0 && params->rgdispidNamedArgs == nullptr)) {
        return E_INVALIDARG;
    }
    const MemberDesc* member = FindMember(type, memid, flags);
    if (member == nullptr) {
        return DISP_E_MEMBERNOTFOUND;
    }
    const bool retval = !member->params.empty() && member->params.back().type.out;
    const size_t inCount = member->params.size() - (retval ? 1 : 0);
    const UINT positional = params->cArgs - params->cNamedArgs;
    const auto failAt = [argErr](HRESULT hr, UINT index) {
        if (argErr != nullptr) {
            *argErr = index;
        }
        return hr;
    };

    // For each parameter in vtable order, its index in rgvarg.
    std::vector<UINT> source(inCount, params->cArgs);
    if (member->kind == INVOKE_PROPERTYPUT) {
        if (params->cNamedArgs != 1 || params->rgdispidNamedArgs[0] != DISPID_PROPERTYPUT) {
            return DISP_E_PARAMNOTFOUND;
        }
        if (params->cArgs != 1) {
            return DISP_E_BADPARAMCOUNT;
        }
        source[0] = 0;
    } else {
        if (params->cArgs != inCount) {
            return DISP_E_BADPARAMCOUNT;
        }
        for (UINT i = 0; i < positional; ++i) {
            source[i] = params->cArgs - 1 - i;
        }
        for (UINT k = 0; k < params->cNamedArgs; ++k) {
            const DISPID id = params->rgdispidNamedArgs[k];
            if (id < static_cast<DISPID>(positional) || id >= static_cast<DISPID>(inCount) ||
                source[static_cast<size_t>(id)] != params->cArgs) {
                return failAt(DISP_E_PARAMNOTFOUND, k);
            }
            source[static_cast<size_t>(id)] = k;
        }
    }

    std::vector<Converted> args(inCount);
    std::vector<VARIANT> values(inCount + 1);
    for (size_t i = 0; i < inCount; ++i) {
        const HRESULT hr =
            Convert(library, member->params[i].type, params->rgvarg[source[i]], args[i]);
        if (FAILED(hr)) {
            Release(args);
            return failAt(hr, source[i]);
        }
        values[i] = args[i].value;
    }
    VARIANT out;
    VariantInit(&out);
    SetErrorInfo(0, nullptr);  // what the member leaves is its own
    const HRESULT hr = member->call(instance, values.data(), &out);
    Release(args);
    if (FAILED(hr)) {
        FillException(hr, excepInfo);
        return DISP_E_EXCEPTION;
    }
    if (retval) {
        out.vt = ValueVartype(library, member->params.back().type);
    }
    if (result != nullptr) {
        *result = out;
    } else {
        VariantClear(&out);
    }
    return hr;
}

}  // namespace automation
