// What the fuzz targets share: an input cut into text fields, and a check that turns a broken
// property into a finding libFuzzer keeps, as it keeps a crash.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

namespace fuzz {

// count fields: each but the last ends at a zero byte (missing ones are empty), the last takes
// the rest, zero bytes included.
inline std::vector<std::string> Fields(const uint8_t* data, size_t size, size_t count) {
    std::vector<std::string> fields(count);
    const char* p = reinterpret_cast<const char*>(data);
    const char* end = p + size;
    for (size_t i = 0; i + 1 < count && p < end; ++i) {
        const char* zero = p;
        while (zero < end && *zero != '\0') {
            ++zero;
        }
        fields[i].assign(p, zero);
        p = zero < end ? zero + 1 : end;
    }
    fields[count - 1].assign(p, end);
    return fields;
}

// A decimal field as the proxy holds ports: digits only, anything else 0.
inline int32_t Port(const std::string& text) {
    int32_t value = 0;
    for (char c : text) {
        if (c < '0' || c > '9' || value > 6553) {
            return 0;
        }
        value = value * 10 + (c - '0');
    }
    return value;
}

}  // namespace fuzz

#define FUZZ_CHECK(condition)                                                                     \
    do {                                                                                          \
        if (!(condition)) {                                                                       \
            std::fprintf(stderr, "%s:%d: property broken: %s\n", __FILE__, __LINE__, #condition); \
            std::abort();                                                                         \
        }                                                                                         \
    } while (0)
