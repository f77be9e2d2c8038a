#pragma once

#include <json/json.h>

#include <optional>
#include <string>

// JSON as all units read and write it. jsoncpp throws where a value has the wrong shape or nests too deep; no
// exception passes here.

namespace TERN::HA::Daemon {

// What jsoncpp throws beside std::bad_alloc when memory runs out: it takes the memory of strings from malloc.
using JsonOutOfMemory = Json::RuntimeError;

// Parses `text`, comments allowed. False, with `value` as it was, when that is no JSON or nests too deep.
bool parseJson(const std::string& text, Json::Value& value);

// The text of `value`: compact, without line end, keys sorted.
std::string jsonText(const Json::Value& value);

// `value` read as a string or a bool; nothing when it cannot be read as one.
std::optional<std::string> readString(const Json::Value& value);
std::optional<bool> readBool(const Json::Value& value);

}  // namespace TERN::HA::Daemon
