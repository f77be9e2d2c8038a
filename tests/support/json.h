#pragma once

#include <json/json.h>

#include <sstream>
#include <string>

namespace test {

/// The value that a JSON text stands for.
inline Json::Value parsed(const std::string& text) {
    Json::Value value;
    std::istringstream(text) >> value;
    return value;
}

}  // namespace test
