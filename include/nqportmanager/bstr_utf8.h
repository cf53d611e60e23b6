// The UTF-8 conversions of BSTRs, header-only so that a client needs nothing but the module's
// BSTR functions. Not part of Windows. Included by bstr.h; include that one.
#pragma once

#include <nqportmanager/bstr.h>

#include <cstddef>
#include <cstdint>
#include <limits>
#include <string>
#include <string_view>

namespace nq_utf8 {

inline constexpr char32_t kReplacement = 0xFFFD;

// Replaces each maximal invalid subpart with one U+FFFD, as Unicode recommends.
template <typename Emit>
inline void DecodeUtf8(std::string_view in, Emit&& emit) {
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

inline void AppendUtf8(std::string& out, char32_t cp) {
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

}  // namespace nq_utf8

inline BSTR BstrFromUtf8(std::string_view utf8) {
    // Two passes so the only allocation is the BSTR itself.
    uint64_t units = 0;
    nq_utf8::DecodeUtf8(utf8, [&units](char32_t cp) { units += cp >= 0x10000 ? 2 : 1; });
    if (units > std::numeric_limits<UINT>::max()) {
        return nullptr;
    }
    BSTR bstr = SysAllocStringLen(nullptr, static_cast<UINT>(units));
    if (bstr == nullptr) {
        return nullptr;
    }
    OLECHAR* p = bstr;
    nq_utf8::DecodeUtf8(utf8, [&p](char32_t cp) {
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

inline std::string Utf8FromBstr(BSTR bstr) {
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
            cp = nq_utf8::kReplacement;
        }
        nq_utf8::AppendUtf8(out, cp);
    }
    return out;
}

inline std::u16string_view BstrView(BSTR bstr) {
    if (bstr == nullptr) {
        return {};
    }
#ifdef _WIN32
    // WCHAR and char16_t are both UTF-16 code units; only their C++ types differ.
    return {reinterpret_cast<const char16_t*>(bstr), SysStringLen(bstr)};
#else
    return {bstr, SysStringLen(bstr)};
#endif
}
