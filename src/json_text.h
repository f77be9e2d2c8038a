#pragma once

#include <json/json.h>

#include <optional>
#include <string>

// Parsing and formatting of JSON for all units. jsoncpp throws on a wrong type or too deep nesting;
// these functions do not.

namespace TERN::HA::Daemon {

// jsoncpp throws this besides std::bad_alloc when memory runs out: it allocates strings with
// malloc.
using JsonOutOfMemory = Json::RuntimeError;

// Parse `text`, comments allowed. Returns false, with `value` unchanged, when it is not JSON or
// nests too deep.
bool parseJson(const std::string& text, Json::Value& value);

// Format `value`: compact, without newline, keys sorted.
std::string jsonText(const Json::Value& value);

// Convert `value` to a string or a bool; nothing when that is impossible.
std::optional<std::string> readString(const Json::Value& value);
std::optional<bool> readBool(const Json::Value& value);

}  // namespace TERN::HA::Daemon
