// SAFEARRAY: one-dimensional arrays only. Arrays must come from SafeArrayCreate* or
// SafeArrayCopy.
#pragma once

#include <nqportmanager/bstr.h>
#include <nqportmanager/comtypes.h>
#include <nqportmanager/variant.h>

#include <limits>
#include <string>
#include <vector>

#ifndef _WIN32
struct SAFEARRAYBOUND {
    ULONG cElements;
    LONG lLbound;
};

struct SAFEARRAY {
    USHORT cDims;
    USHORT fFeatures;
    ULONG cbElements;
    ULONG cLocks;
    void* pvData;
    SAFEARRAYBOUND rgsabound[1];
};

inline constexpr USHORT FADF_HAVEVARTYPE = 0x0080;
inline constexpr USHORT FADF_BSTR = 0x0100;
inline constexpr USHORT FADF_UNKNOWN = 0x0200;
inline constexpr USHORT FADF_DISPATCH = 0x0400;
inline constexpr USHORT FADF_VARIANT = 0x0800;

extern "C" {
NQ_MODULE_EXPORT SAFEARRAY* SafeArrayCreate(VARTYPE vt, UINT cDims, SAFEARRAYBOUND* rgsabound);
NQ_MODULE_EXPORT SAFEARRAY* SafeArrayCreateVector(VARTYPE vt, LONG lLbound, ULONG cElements);
NQ_MODULE_EXPORT HRESULT SafeArrayDestroy(SAFEARRAY* psa);
NQ_MODULE_EXPORT UINT SafeArrayGetDim(SAFEARRAY* psa);
NQ_MODULE_EXPORT UINT SafeArrayGetElemsize(SAFEARRAY* psa);
NQ_MODULE_EXPORT HRESULT SafeArrayGetLBound(SAFEARRAY* psa, UINT nDim, LONG* plLbound);
NQ_MODULE_EXPORT HRESULT SafeArrayGetUBound(SAFEARRAY* psa, UINT nDim, LONG* plUbound);
NQ_MODULE_EXPORT HRESULT SafeArrayGetElement(SAFEARRAY* psa, LONG* rgIndices, void* pv);
NQ_MODULE_EXPORT HRESULT SafeArrayPutElement(SAFEARRAY* psa, LONG* rgIndices, void* pv);
NQ_MODULE_EXPORT HRESULT SafeArrayGetVartype(SAFEARRAY* psa, VARTYPE* pvt);
NQ_MODULE_EXPORT HRESULT SafeArrayLock(SAFEARRAY* psa);
NQ_MODULE_EXPORT HRESULT SafeArrayUnlock(SAFEARRAY* psa);
NQ_MODULE_EXPORT HRESULT SafeArrayAccessData(SAFEARRAY* psa, void** ppvData);
NQ_MODULE_EXPORT HRESULT SafeArrayUnaccessData(SAFEARRAY* psa);
NQ_MODULE_EXPORT HRESULT SafeArrayCopy(SAFEARRAY* psa, SAFEARRAY** ppsaOut);
}  // extern "C"
#endif  // _WIN32

// VT_BSTR vector with lower bound 0 (not part of Windows); null on allocation failure.
inline SAFEARRAY* MakeBstrArray(const std::vector<std::string>& utf8Items) {
    if (utf8Items.size() > std::numeric_limits<ULONG>::max()) {
        return nullptr;
    }
    SAFEARRAY* psa = SafeArrayCreateVector(VT_BSTR, 0, static_cast<ULONG>(utf8Items.size()));
    if (psa == nullptr) {
        return nullptr;
    }
    for (size_t i = 0; i < utf8Items.size(); ++i) {
        BSTR item = BstrFromUtf8(utf8Items[i]);
        if (item == nullptr) {
            SafeArrayDestroy(psa);
            return nullptr;
        }
        static_cast<BSTR*>(psa->pvData)[i] = item;
    }
    return psa;
}
