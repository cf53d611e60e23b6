// GUID, its text form and the standard interface IDs.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#ifdef _WIN32
#include <nqportmanager/comtypes.h>
#else
struct GUID {
    uint32_t Data1;
    uint16_t Data2;
    uint16_t Data3;
    uint8_t Data4[8];

    constexpr bool operator==(const GUID&) const = default;
};

typedef GUID IID;
typedef GUID CLSID;
typedef const GUID& REFGUID;
typedef const IID& REFIID;
typedef const CLSID& REFCLSID;

constexpr bool IsEqualGUID(REFGUID a, REFGUID b) {
    return a == b;
}
constexpr bool IsEqualIID(REFIID a, REFIID b) {
    return a == b;
}
constexpr bool IsEqualCLSID(REFCLSID a, REFCLSID b) {
    return a == b;
}
#endif  // _WIN32

// Parses "XXXXXXXX-XXXX-XXXX-XXXX-XXXXXXXXXXXX", with or without braces, either case. On failure
// *out is left untouched. constexpr so that MakeGuid can check literals at compile time.
constexpr bool GuidFromString(std::string_view text, GUID* out) {
    if (out == nullptr) {
        return false;
    }
    if (text.size() == 38 && text.front() == '{' && text.back() == '}') {
        text = text.substr(1, 36);
    }
    if (text.size() != 36) {
        return false;
    }
    uint8_t bytes[16] = {};
    size_t pos = 0;
    for (int i = 0; i < 16; ++i) {
        if (pos == 8 || pos == 13 || pos == 18 || pos == 23) {
            if (text[pos] != '-') {
                return false;
            }
            ++pos;
        }
        int value = 0;
        for (int nibble = 0; nibble < 2; ++nibble) {
            const char c = text[pos++];
            int digit = 0;
            if (c >= '0' && c <= '9') {
                digit = c - '0';
            } else if (c >= 'a' && c <= 'f') {
                digit = c - 'a' + 10;
            } else if (c >= 'A' && c <= 'F') {
                digit = c - 'A' + 10;
            } else {
                return false;
            }
            value = value * 16 + digit;
        }
        bytes[i] = static_cast<uint8_t>(value);
    }
    GUID g{};
    g.Data1 = (uint32_t{bytes[0]} << 24) | (uint32_t{bytes[1]} << 16) | (uint32_t{bytes[2]} << 8) |
              uint32_t{bytes[3]};
    g.Data2 = static_cast<uint16_t>((bytes[4] << 8) | bytes[5]);
    g.Data3 = static_cast<uint16_t>((bytes[6] << 8) | bytes[7]);
    for (int i = 0; i < 8; ++i) {
        g.Data4[i] = bytes[8 + i];
    }
    *out = g;
    return true;
}

// GUID literal checked by the compiler: MakeGuid("B196B284-BAB4-101A-B69C-00AA00341D07").
consteval GUID MakeGuid(std::string_view text) {
    GUID g{};
    if (!GuidFromString(text, &g)) {
        throw "malformed GUID literal";  // Reached only at compile time: a compile error.
    }
    return g;
}

// "{XXXXXXXX-XXXX-XXXX-XXXX-XXXXXXXXXXXX}", upper case. Not part of Windows (its StringFromGUID2
// writes wide characters), so it stays portable.
inline std::string GuidToString(const GUID& guid) {
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

#ifndef _WIN32
inline constexpr GUID GUID_NULL = {};
inline constexpr IID IID_IUnknown = MakeGuid("00000000-0000-0000-C000-000000000046");
inline constexpr IID IID_IDispatch = MakeGuid("00020400-0000-0000-C000-000000000046");
inline constexpr IID IID_IClassFactory = MakeGuid("00000001-0000-0000-C000-000000000046");
inline constexpr IID IID_IConnectionPointContainer =
    MakeGuid("B196B284-BAB4-101A-B69C-00AA00341D07");
inline constexpr IID IID_IEnumConnectionPoints = MakeGuid("B196B285-BAB4-101A-B69C-00AA00341D07");
inline constexpr IID IID_IConnectionPoint = MakeGuid("B196B286-BAB4-101A-B69C-00AA00341D07");
inline constexpr IID IID_IEnumConnections = MakeGuid("B196B287-BAB4-101A-B69C-00AA00341D07");
inline constexpr IID IID_ISupportErrorInfo = MakeGuid("DF0B3D60-548F-101B-8E65-08002B2BD119");
#endif  // _WIN32
