// Linux stand-in for oleaut32's BSTR functions.
#include "nqportmanager/bstr.h"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <string>

#include "platform/linux/com_internal.h"

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

}  // namespace

BSTR platform::CopyBstr(BSTR src) {
    if (src == nullptr) {
        return nullptr;
    }
    return SysAllocStringByteLen(reinterpret_cast<const char*>(src), SysStringByteLen(src));
}

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
