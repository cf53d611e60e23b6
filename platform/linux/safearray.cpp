// Linux stand-in for oleaut32's SAFEARRAY functions.
#include "nqportmanager/safearray.h"

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <utility>

#include "nqportmanager/bstr.h"
#include "platform/linux/com_internal.h"

namespace {

// The element type sits in the 4 bytes just before the descriptor, where Windows keeps it.
struct ArrayBlock {
    DWORD reserved;
    DWORD vt;
    SAFEARRAY sa;
};
static_assert(offsetof(ArrayBlock, sa) - offsetof(ArrayBlock, vt) == sizeof(DWORD));

ArrayBlock* BlockOf(SAFEARRAY* psa) {
    return reinterpret_cast<ArrayBlock*>(reinterpret_cast<unsigned char*>(psa) -
                                         offsetof(ArrayBlock, sa));
}

ULONG ElementSize(VARTYPE vt) {
    switch (vt) {
        case VT_UI1:
            return 1;
        case VT_I2:
        case VT_BOOL:
            return 2;
        case VT_I4:
        case VT_UI4:
        case VT_INT:
        case VT_UINT:
            return 4;
        case VT_BSTR:
            return sizeof(BSTR);
        case VT_UNKNOWN:
            return sizeof(IUnknown*);
        case VT_DISPATCH:
            return sizeof(IDispatch*);
        case VT_VARIANT:
            return sizeof(VARIANT);
        default:
            return 0;
    }
}

USHORT FeaturesOf(VARTYPE vt) {
    switch (vt) {
        case VT_BSTR:
            return FADF_HAVEVARTYPE | FADF_BSTR;
        case VT_UNKNOWN:
            return FADF_HAVEVARTYPE | FADF_UNKNOWN;
        case VT_DISPATCH:
            return FADF_HAVEVARTYPE | FADF_DISPATCH;
        case VT_VARIANT:
            return FADF_HAVEVARTYPE | FADF_VARIANT;
        default:
            return FADF_HAVEVARTYPE;
    }
}

VARTYPE ElementVartype(SAFEARRAY* psa) {
    if ((psa->fFeatures & FADF_HAVEVARTYPE) != 0) {
        return static_cast<VARTYPE>(BlockOf(psa)->vt);
    }
    if ((psa->fFeatures & FADF_BSTR) != 0) {
        return VT_BSTR;
    }
    if ((psa->fFeatures & FADF_UNKNOWN) != 0) {
        return VT_UNKNOWN;
    }
    if ((psa->fFeatures & FADF_DISPATCH) != 0) {
        return VT_DISPATCH;
    }
    if ((psa->fFeatures & FADF_VARIANT) != 0) {
        return VT_VARIANT;
    }
    return VT_EMPTY;
}

template <typename T>
T* Elements(SAFEARRAY* psa) {
    return static_cast<T*>(psa->pvData);
}

void ClearElements(SAFEARRAY* psa) {
    const ULONG count = psa->rgsabound[0].cElements;
    switch (ElementVartype(psa)) {
        case VT_BSTR:
            for (ULONG i = 0; i < count; ++i) {
                SysFreeString(std::exchange(Elements<BSTR>(psa)[i], nullptr));
            }
            break;
        case VT_UNKNOWN:
        case VT_DISPATCH:  // an IDispatch pointer is its IUnknown pointer
            for (ULONG i = 0; i < count; ++i) {
                if (IUnknown* p = std::exchange(Elements<IUnknown*>(psa)[i], nullptr)) {
                    p->Release();
                }
            }
            break;
        case VT_VARIANT:
            for (ULONG i = 0; i < count; ++i) {
                VariantClear(&Elements<VARIANT>(psa)[i]);
            }
            break;
        default:
            break;
    }
}

HRESULT ElementAddress(SAFEARRAY* psa, const LONG* rgIndices, unsigned char** address) {
    if (psa == nullptr || rgIndices == nullptr || psa->cDims != 1 || psa->pvData == nullptr) {
        return E_INVALIDARG;
    }
    const int64_t offset = int64_t{rgIndices[0]} - int64_t{psa->rgsabound[0].lLbound};
    if (offset < 0 || offset >= int64_t{psa->rgsabound[0].cElements}) {
        return DISP_E_BADINDEX;
    }
    *address = static_cast<unsigned char*>(psa->pvData) + offset * psa->cbElements;
    return S_OK;
}

// Holds a lock for the duration of one element access, as the Windows functions do.
class ScopedLock {
  public:
    explicit ScopedLock(SAFEARRAY* psa) : psa_(psa) { ++psa_->cLocks; }
    ~ScopedLock() { --psa_->cLocks; }
    ScopedLock(const ScopedLock&) = delete;
    ScopedLock& operator=(const ScopedLock&) = delete;

  private:
    SAFEARRAY* psa_;
};

}  // namespace

SAFEARRAY* SafeArrayCreate(VARTYPE vt, UINT cDims, SAFEARRAYBOUND* rgsabound) {
    if (cDims != 1 || rgsabound == nullptr) {
        return nullptr;
    }
    return SafeArrayCreateVector(vt, rgsabound[0].lLbound, rgsabound[0].cElements);
}

SAFEARRAY* SafeArrayCreateVector(VARTYPE vt, LONG lLbound, ULONG cElements) {
    const ULONG size = ElementSize(vt);
    if (size == 0) {
        return nullptr;
    }
    auto* block = static_cast<ArrayBlock*>(std::calloc(1, sizeof(ArrayBlock)));
    // Zeroed memory is already VT_EMPTY / null for every supported element type.
    void* data = std::calloc(cElements == 0 ? 1 : cElements, size);
    if (block == nullptr || data == nullptr) {
        std::free(block);
        std::free(data);
        return nullptr;
    }
    block->vt = vt;
    SAFEARRAY* psa = &block->sa;
    psa->cDims = 1;
    psa->fFeatures = FeaturesOf(vt);
    psa->cbElements = size;
    psa->cLocks = 0;
    psa->pvData = data;
    psa->rgsabound[0].cElements = cElements;
    psa->rgsabound[0].lLbound = lLbound;
    return psa;
}

HRESULT SafeArrayDestroy(SAFEARRAY* psa) {
    if (psa == nullptr) {
        return S_OK;
    }
    if (psa->cLocks > 0) {
        return DISP_E_ARRAYISLOCKED;
    }
    ClearElements(psa);
    std::free(psa->pvData);
    std::free(BlockOf(psa));
    return S_OK;
}

UINT SafeArrayGetDim(SAFEARRAY* psa) {
    return psa == nullptr ? 0 : psa->cDims;
}

UINT SafeArrayGetElemsize(SAFEARRAY* psa) {
    return psa == nullptr ? 0 : psa->cbElements;
}

HRESULT SafeArrayGetLBound(SAFEARRAY* psa, UINT nDim, LONG* plLbound) {
    if (psa == nullptr || plLbound == nullptr) {
        return E_INVALIDARG;
    }
    if (nDim == 0 || nDim > psa->cDims) {
        return DISP_E_BADINDEX;
    }
    *plLbound = psa->rgsabound[0].lLbound;
    return S_OK;
}

HRESULT SafeArrayGetUBound(SAFEARRAY* psa, UINT nDim, LONG* plUbound) {
    if (psa == nullptr || plUbound == nullptr) {
        return E_INVALIDARG;
    }
    if (nDim == 0 || nDim > psa->cDims) {
        return DISP_E_BADINDEX;
    }
    const SAFEARRAYBOUND& bound = psa->rgsabound[0];
    *plUbound = static_cast<LONG>(int64_t{bound.lLbound} + int64_t{bound.cElements} - 1);
    return S_OK;
}

HRESULT SafeArrayGetElement(SAFEARRAY* psa, LONG* rgIndices, void* pv) {
    if (pv == nullptr) {
        return E_INVALIDARG;
    }
    unsigned char* address = nullptr;
    HRESULT hr = ElementAddress(psa, rgIndices, &address);
    if (FAILED(hr)) {
        return hr;
    }
    ScopedLock lock(psa);
    switch (ElementVartype(psa)) {
        case VT_BSTR: {
            const BSTR src = *reinterpret_cast<BSTR*>(address);
            const BSTR copy = platform::CopyBstr(src);
            if (src != nullptr && copy == nullptr) {
                return E_OUTOFMEMORY;
            }
            *static_cast<BSTR*>(pv) = copy;
            return S_OK;
        }
        case VT_UNKNOWN:
        case VT_DISPATCH: {  // an IDispatch pointer is its IUnknown pointer
            IUnknown* p = *reinterpret_cast<IUnknown**>(address);
            if (p != nullptr) {
                p->AddRef();
            }
            *static_cast<IUnknown**>(pv) = p;
            return S_OK;
        }
        case VT_VARIANT: {
            // The destination is treated as uninitialised, as on Windows.
            VARIANT copy;
            VariantInit(&copy);
            hr = VariantCopy(&copy, reinterpret_cast<VARIANT*>(address));
            if (FAILED(hr)) {
                return hr;
            }
            *static_cast<VARIANT*>(pv) = copy;
            return S_OK;
        }
        default:
            std::memcpy(pv, address, psa->cbElements);
            return S_OK;
    }
}

HRESULT SafeArrayPutElement(SAFEARRAY* psa, LONG* rgIndices, void* pv) {
    unsigned char* address = nullptr;
    HRESULT hr = ElementAddress(psa, rgIndices, &address);
    if (FAILED(hr)) {
        return hr;
    }
    ScopedLock lock(psa);
    // Copy the new value before releasing the old one: they may be the same object.
    switch (ElementVartype(psa)) {
        case VT_BSTR: {
            const auto src = static_cast<BSTR>(pv);
            const BSTR copy = platform::CopyBstr(src);
            if (src != nullptr && copy == nullptr) {
                return E_OUTOFMEMORY;
            }
            SysFreeString(std::exchange(*reinterpret_cast<BSTR*>(address), copy));
            return S_OK;
        }
        case VT_UNKNOWN:
        case VT_DISPATCH: {  // an IDispatch pointer is its IUnknown pointer
            auto* p = static_cast<IUnknown*>(pv);
            if (p != nullptr) {
                p->AddRef();
            }
            if (IUnknown* old = std::exchange(*reinterpret_cast<IUnknown**>(address), p)) {
                old->Release();
            }
            return S_OK;
        }
        case VT_VARIANT: {
            if (pv == nullptr) {
                return E_INVALIDARG;
            }
            VARIANT copy;
            VariantInit(&copy);
            hr = VariantCopy(&copy, static_cast<VARIANT*>(pv));
            if (FAILED(hr)) {
                return hr;
            }
            auto* element = reinterpret_cast<VARIANT*>(address);
            hr = VariantClear(element);
            if (FAILED(hr)) {
                VariantClear(&copy);
                return hr;
            }
            *element = copy;
            return S_OK;
        }
        default:
            if (pv == nullptr) {
                return E_INVALIDARG;
            }
            std::memcpy(address, pv, psa->cbElements);
            return S_OK;
    }
}

HRESULT SafeArrayGetVartype(SAFEARRAY* psa, VARTYPE* pvt) {
    if (psa == nullptr || pvt == nullptr) {
        return E_INVALIDARG;
    }
    const VARTYPE vt = ElementVartype(psa);
    if (vt == VT_EMPTY) {
        return E_INVALIDARG;
    }
    *pvt = vt;
    return S_OK;
}

HRESULT SafeArrayLock(SAFEARRAY* psa) {
    if (psa == nullptr) {
        return E_INVALIDARG;
    }
    if (psa->cLocks == std::numeric_limits<ULONG>::max()) {
        return E_UNEXPECTED;
    }
    ++psa->cLocks;
    return S_OK;
}

HRESULT SafeArrayUnlock(SAFEARRAY* psa) {
    if (psa == nullptr) {
        return E_INVALIDARG;
    }
    if (psa->cLocks == 0) {
        return E_UNEXPECTED;
    }
    --psa->cLocks;
    return S_OK;
}

HRESULT SafeArrayAccessData(SAFEARRAY* psa, void** ppvData) {
    if (psa == nullptr || ppvData == nullptr) {
        return E_INVALIDARG;
    }
    const HRESULT hr = SafeArrayLock(psa);
    if (FAILED(hr)) {
        return hr;
    }
    *ppvData = psa->pvData;
    return S_OK;
}

HRESULT SafeArrayUnaccessData(SAFEARRAY* psa) {
    return SafeArrayUnlock(psa);
}

HRESULT SafeArrayCopy(SAFEARRAY* psa, SAFEARRAY** ppsaOut) {
    if (ppsaOut == nullptr) {
        return E_INVALIDARG;
    }
    *ppsaOut = nullptr;
    if (psa == nullptr) {
        return S_OK;
    }
    if (psa->cDims != 1) {
        return E_INVALIDARG;
    }
    const VARTYPE vt = ElementVartype(psa);
    const ULONG count = psa->rgsabound[0].cElements;
    SAFEARRAY* copy = SafeArrayCreateVector(vt, psa->rgsabound[0].lLbound, count);
    if (copy == nullptr) {
        return vt == VT_EMPTY ? E_INVALIDARG : E_OUTOFMEMORY;
    }
    HRESULT hr = S_OK;
    switch (vt) {
        case VT_BSTR:
            for (ULONG i = 0; i < count && SUCCEEDED(hr); ++i) {
                const BSTR src = Elements<BSTR>(psa)[i];
                Elements<BSTR>(copy)[i] = platform::CopyBstr(src);
                if (src != nullptr && Elements<BSTR>(copy)[i] == nullptr) {
                    hr = E_OUTOFMEMORY;
                }
            }
            break;
        case VT_UNKNOWN:
        case VT_DISPATCH:  // an IDispatch pointer is its IUnknown pointer
            for (ULONG i = 0; i < count; ++i) {
                if (IUnknown* p = Elements<IUnknown*>(psa)[i]) {
                    p->AddRef();
                    Elements<IUnknown*>(copy)[i] = p;
                }
            }
            break;
        case VT_VARIANT:
            for (ULONG i = 0; i < count && SUCCEEDED(hr); ++i) {
                hr = VariantCopy(&Elements<VARIANT>(copy)[i], &Elements<VARIANT>(psa)[i]);
            }
            break;
        default:
            std::memcpy(copy->pvData, psa->pvData, size_t{count} * psa->cbElements);
            break;
    }
    if (FAILED(hr)) {
        SafeArrayDestroy(copy);
        return hr;
    }
    *ppsaOut = copy;
    return S_OK;
}
