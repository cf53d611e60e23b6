#include "nqportmanager/com.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <string>
#include <utility>

// ---- GUID ------------------------------------------------------------------------------------

std::string GuidToString(const GUID& guid) {
    static constexpr char kHex[] = "0123456789ABCDEF";
    std::string out;
    out.reserve(38);
    auto put = [&out](uint64_t value, int digits) {
        for (int shift = (digits - 1) * 4; shift >= 0; shift -= 4) {
            out.push_back(kHex[(value >> shift) & 0xF]);
        }
    };
    out.push_back('{');
    put(guid.Data1, 8);
    out.push_back('-');
    put(guid.Data2, 4);
    out.push_back('-');
    put(guid.Data3, 4);
    out.push_back('-');
    put(guid.Data4[0], 2);
    put(guid.Data4[1], 2);
    out.push_back('-');
    for (int i = 2; i < 8; ++i) {
        put(guid.Data4[i], 2);
    }
    out.push_back('}');
    return out;
}

// ---- BSTR ------------------------------------------------------------------------------------

namespace {

// Windows x64 puts 4 spare bytes before the length so the characters are 8-byte aligned.
constexpr size_t kBstrHeader = 8;
constexpr size_t kBstrPrefix = sizeof(uint32_t);
constexpr uint32_t kMaxBstrBytes =
    std::numeric_limits<uint32_t>::max() - kBstrHeader - sizeof(OLECHAR);

unsigned char* BstrBase(BSTR bstr) {
    return reinterpret_cast<unsigned char*>(bstr) - kBstrHeader;
}

// Uninitialised characters, but prefix and terminator set.
BSTR AllocBstrBytes(uint64_t bytes) {
    if (bytes > kMaxBstrBytes) {
        return nullptr;
    }
    const auto byteCount = static_cast<uint32_t>(bytes);
    auto* base =
        static_cast<unsigned char*>(std::malloc(kBstrHeader + byteCount + sizeof(OLECHAR)));
    if (base == nullptr) {
        return nullptr;
    }
    std::memset(base, 0, kBstrHeader - kBstrPrefix);
    std::memcpy(base + kBstrHeader - kBstrPrefix, &byteCount, kBstrPrefix);
    base[kBstrHeader + byteCount] = 0;
    base[kBstrHeader + byteCount + 1] = 0;
    return reinterpret_cast<BSTR>(base + kBstrHeader);
}

BSTR AllocBstrChars(uint64_t chars) {
    return AllocBstrBytes(chars * sizeof(OLECHAR));
}

// Byte-exact copy, so odd byte lengths from SysAllocStringByteLen survive.
BSTR CopyBstr(BSTR src) {
    if (src == nullptr) {
        return nullptr;
    }
    return SysAllocStringByteLen(reinterpret_cast<const char*>(src), SysStringByteLen(src));
}

}  // namespace

BSTR SysAllocString(const OLECHAR* psz) {
    if (psz == nullptr) {
        return nullptr;
    }
    const size_t len = std::char_traits<OLECHAR>::length(psz);
    if (len > std::numeric_limits<UINT>::max()) {
        return nullptr;
    }
    return SysAllocStringLen(psz, static_cast<UINT>(len));
}

BSTR SysAllocStringLen(const OLECHAR* strIn, UINT ui) {
    BSTR bstr = AllocBstrChars(ui);
    if (bstr == nullptr) {
        return nullptr;
    }
    if (strIn != nullptr) {
        std::memcpy(bstr, strIn, size_t{ui} * sizeof(OLECHAR));
    } else {
        std::memset(bstr, 0, size_t{ui} * sizeof(OLECHAR));
    }
    return bstr;
}

BSTR SysAllocStringByteLen(const char* psz, UINT len) {
    BSTR bstr = AllocBstrBytes(len);
    if (bstr == nullptr) {
        return nullptr;
    }
    if (psz != nullptr) {
        std::memcpy(bstr, psz, len);
    } else {
        std::memset(bstr, 0, len);
    }
    return bstr;
}

INT SysReAllocString(BSTR* pbstr, const OLECHAR* psz) {
    if (pbstr == nullptr) {
        return 0;
    }
    // Allocate before freeing: psz may point into *pbstr.
    BSTR fresh = SysAllocString(psz);
    if (psz != nullptr && fresh == nullptr) {
        return 0;
    }
    SysFreeString(*pbstr);
    *pbstr = fresh;
    return 1;
}

INT SysReAllocStringLen(BSTR* pbstr, const OLECHAR* psz, UINT len) {
    if (pbstr == nullptr) {
        return 0;
    }
    BSTR fresh = AllocBstrChars(len);
    if (fresh == nullptr) {
        return 0;
    }
    if (psz != nullptr) {
        std::memcpy(fresh, psz, size_t{len} * sizeof(OLECHAR));
    } else {
        // Keep the old characters like realloc does; ATL-style appends rely on it.
        const UINT keep = std::min(len, SysStringLen(*pbstr));
        if (keep > 0) {
            std::memcpy(fresh, *pbstr, size_t{keep} * sizeof(OLECHAR));
        }
        std::memset(fresh + keep, 0, size_t{len - keep} * sizeof(OLECHAR));
    }
    SysFreeString(*pbstr);
    *pbstr = fresh;
    return 1;
}

void SysFreeString(BSTR bstrString) {
    if (bstrString != nullptr) {
        std::free(BstrBase(bstrString));
    }
}

UINT SysStringByteLen(BSTR bstr) {
    if (bstr == nullptr) {
        return 0;
    }
    uint32_t bytes = 0;
    std::memcpy(&bytes, BstrBase(bstr) + kBstrHeader - kBstrPrefix, kBstrPrefix);
    return bytes;
}

UINT SysStringLen(BSTR pbstr) {
    return SysStringByteLen(pbstr) / sizeof(OLECHAR);
}

// ---- UTF-8 -----------------------------------------------------------------------------------

namespace {

constexpr char32_t kReplacement = 0xFFFD;

// Replaces each maximal invalid subpart with one U+FFFD, as Unicode recommends.
template <typename Emit>
void DecodeUtf8(std::string_view in, Emit&& emit) {
    size_t i = 0;
    const size_t n = in.size();
    while (i < n) {
        const auto b0 = static_cast<unsigned char>(in[i]);
        if (b0 < 0x80) {
            emit(char32_t{b0});
            ++i;
            continue;
        }
        int need = 0;
        unsigned char lo = 0x80;
        unsigned char hi = 0xBF;
        if (b0 >= 0xC2 && b0 <= 0xDF) {
            need = 1;
        } else if (b0 >= 0xE0 && b0 <= 0xEF) {
            need = 2;
            if (b0 == 0xE0) {
                lo = 0xA0;  // overlong
            } else if (b0 == 0xED) {
                hi = 0x9F;  // surrogates
            }
        } else if (b0 >= 0xF0 && b0 <= 0xF4) {
            need = 3;
            if (b0 == 0xF0) {
                lo = 0x90;  // overlong
            } else if (b0 == 0xF4) {
                hi = 0x8F;  // above U+10FFFF
            }
        } else {
            emit(kReplacement);
            ++i;
            continue;
        }
        char32_t cp = b0 & (0x3F >> need);
        ++i;
        bool ok = true;
        for (int k = 0; k < need; ++k) {
            if (i >= n) {
                ok = false;
                break;
            }
            const auto b = static_cast<unsigned char>(in[i]);
            if (b < lo || b > hi) {
                ok = false;
                break;
            }
            cp = (cp << 6) | (b & 0x3F);
            lo = 0x80;
            hi = 0xBF;
            ++i;
        }
        emit(ok ? cp : kReplacement);
    }
}

void AppendUtf8(std::string& out, char32_t cp) {
    if (cp < 0x80) {
        out.push_back(static_cast<char>(cp));
    } else if (cp < 0x800) {
        out.push_back(static_cast<char>(0xC0 | (cp >> 6)));
        out.push_back(static_cast<char>(0x80 | (cp & 0x3F)));
    } else if (cp < 0x10000) {
        out.push_back(static_cast<char>(0xE0 | (cp >> 12)));
        out.push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
        out.push_back(static_cast<char>(0x80 | (cp & 0x3F)));
    } else {
        out.push_back(static_cast<char>(0xF0 | (cp >> 18)));
        out.push_back(static_cast<char>(0x80 | ((cp >> 12) & 0x3F)));
        out.push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
        out.push_back(static_cast<char>(0x80 | (cp & 0x3F)));
    }
}

}  // namespace

BSTR BstrFromUtf8(std::string_view utf8) {
    // Two passes so the only allocation is the BSTR itself.
    uint64_t units = 0;
    DecodeUtf8(utf8, [&units](char32_t cp) { units += cp >= 0x10000 ? 2 : 1; });
    BSTR bstr = AllocBstrChars(units);
    if (bstr == nullptr) {
        return nullptr;
    }
    OLECHAR* p = bstr;
    DecodeUtf8(utf8, [&p](char32_t cp) {
        if (cp >= 0x10000) {
            cp -= 0x10000;
            *p++ = static_cast<OLECHAR>(0xD800 + (cp >> 10));
            *p++ = static_cast<OLECHAR>(0xDC00 + (cp & 0x3FF));
        } else {
            *p++ = static_cast<OLECHAR>(cp);
        }
    });
    return bstr;
}

std::string Utf8FromBstr(BSTR bstr) {
    const std::u16string_view in = BstrView(bstr);
    std::string out;
    out.reserve(in.size());
    for (size_t i = 0; i < in.size(); ++i) {
        char32_t cp = in[i];
        if (cp >= 0xD800 && cp <= 0xDBFF && i + 1 < in.size() && in[i + 1] >= 0xDC00 &&
            in[i + 1] <= 0xDFFF) {
            cp = 0x10000 + ((cp - 0xD800) << 10) + (in[i + 1] - 0xDC00);
            ++i;
        } else if (cp >= 0xD800 && cp <= 0xDFFF) {
            cp = kReplacement;
        }
        AppendUtf8(out, cp);
    }
    return out;
}

std::u16string_view BstrView(BSTR bstr) {
    if (bstr == nullptr) {
        return {};
    }
    return {bstr, SysStringLen(bstr)};
}

// ---- VARIANT ---------------------------------------------------------------------------------

namespace {

bool IsArrayElementType(VARTYPE vt) {
    switch (vt) {
        case VT_BSTR:
        case VT_I4:
        case VT_UI4:
        case VT_INT:
        case VT_UINT:
        case VT_I2:
        case VT_UI1:
        case VT_BOOL:
        case VT_VARIANT:
        case VT_UNKNOWN:
        case VT_DISPATCH:
            return true;
        default:
            return false;
    }
}

bool IsValidVartype(VARTYPE vt) {
    if ((vt & ~(VT_ARRAY | VT_BYREF | VT_TYPEMASK)) != 0) {
        return false;
    }
    const VARTYPE base = vt & VT_TYPEMASK;
    if ((vt & VT_ARRAY) != 0) {
        return IsArrayElementType(base);
    }
    if (base == VT_EMPTY || base == VT_NULL || base == VT_ERROR) {
        return (vt & VT_BYREF) == 0 || base == VT_ERROR;
    }
    if (base == VT_VARIANT) {
        return (vt & VT_BYREF) != 0;
    }
    return IsArrayElementType(base);
}

}  // namespace

void VariantInit(VARIANTARG* pvarg) {
    if (pvarg == nullptr) {
        return;
    }
    pvarg->vt = VT_EMPTY;
    pvarg->wReserved1 = 0;
    pvarg->wReserved2 = 0;
    pvarg->wReserved3 = 0;
}

HRESULT VariantClear(VARIANTARG* pvarg) {
    if (pvarg == nullptr) {
        return E_INVALIDARG;
    }
    const VARTYPE vt = pvarg->vt;
    if (!IsValidVartype(vt)) {
        return DISP_E_BADVARTYPE;
    }
    if ((vt & VT_BYREF) == 0) {
        if ((vt & VT_ARRAY) != 0) {
            const HRESULT hr = SafeArrayDestroy(pvarg->parray);
            if (FAILED(hr)) {
                return hr;
            }
        } else if (vt == VT_BSTR) {
            SysFreeString(pvarg->bstrVal);
        } else if (vt == VT_UNKNOWN) {
            if (pvarg->punkVal != nullptr) {
                pvarg->punkVal->Release();
            }
        } else if (vt == VT_DISPATCH) {
            if (pvarg->pdispVal != nullptr) {
                pvarg->pdispVal->Release();
            }
        }
    }
    pvarg->vt = VT_EMPTY;
    return S_OK;
}

HRESULT VariantCopy(VARIANTARG* pvargDest, const VARIANTARG* pvargSrc) {
    if (pvargDest == nullptr || pvargSrc == nullptr) {
        return E_INVALIDARG;
    }
    if (pvargDest == pvargSrc) {
        return S_OK;
    }
    const VARTYPE vt = pvargSrc->vt;
    if (!IsValidVartype(vt)) {
        return DISP_E_BADVARTYPE;
    }
    HRESULT hr = VariantClear(pvargDest);
    if (FAILED(hr)) {
        return hr;
    }
    VARIANT copy = *pvargSrc;
    if ((vt & VT_BYREF) == 0) {
        if ((vt & VT_ARRAY) != 0) {
            hr = SafeArrayCopy(pvargSrc->parray, &copy.parray);
            if (FAILED(hr)) {
                return hr;
            }
        } else if (vt == VT_BSTR) {
            copy.bstrVal = CopyBstr(pvargSrc->bstrVal);
            if (pvargSrc->bstrVal != nullptr && copy.bstrVal == nullptr) {
                return E_OUTOFMEMORY;
            }
        } else if (vt == VT_UNKNOWN) {
            if (copy.punkVal != nullptr) {
                copy.punkVal->AddRef();
            }
        } else if (vt == VT_DISPATCH) {
            if (copy.pdispVal != nullptr) {
                copy.pdispVal->AddRef();
            }
        }
    }
    *pvargDest = copy;
    return S_OK;
}

// ---- SAFEARRAY -------------------------------------------------------------------------------

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
            const BSTR copy = CopyBstr(src);
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
            const BSTR copy = CopyBstr(src);
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
                Elements<BSTR>(copy)[i] = CopyBstr(src);
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

SAFEARRAY* MakeBstrArray(const std::vector<std::string>& utf8Items) {
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
        Elements<BSTR>(psa)[i] = item;
    }
    return psa;
}
