// Reading nqpm's JSON output in tests.
#pragma once

#include <gtest/gtest.h>

#include <string>

#include <nlohmann/json.hpp>

namespace testsupport {

// The one object on the output's first line; a failure (and null) when it is not JSON.
inline nlohmann::json ParseJson(const std::string& output) {
    auto value = nlohmann::json::parse(output.substr(0, output.find('\n')), nullptr, false);
    if (value.is_discarded()) {
        ADD_FAILURE() << "not JSON: " << output;
        return nullptr;
    }
    return value;
}

}  // namespace testsupport
