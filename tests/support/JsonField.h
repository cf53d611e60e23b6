// Reading one field of the flat JSON objects nqpm prints, for tests that run it.
#pragma once

#include <string>

namespace testsupport {

// The value of "key": strings without their quotes, numbers, true/false and null as written.
inline std::string JsonField(const std::string& json, const std::string& key) {
    const std::string tag = "\"" + key + "\":";
    const auto at = json.find(tag);
    if (at == std::string::npos) {
        return "<missing>";
    }
    const auto start = at + tag.size();
    if (json.compare(start, 1, "\"") == 0) {
        return json.substr(start + 1, json.find('"', start + 1) - start - 1);
    }
    return json.substr(start, json.find_first_of(",}", start) - start);
}

}  // namespace testsupport
