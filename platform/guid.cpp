// Not part of Windows (its StringFromGUID2 writes wide characters), so it stays portable.
#include "nqportmanager/guid.h"

#include <cstdint>
#include <string>

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
