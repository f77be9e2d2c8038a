#include "json_text.h"

namespace TERN::HA::Daemon {

// jsoncpp calls both classes deprecated in favour of builders that read their settings from a map
// on every use and accept other texts.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"

bool parseJson(const std::string& text, Json::Value& value) {
    try {
        Json::Reader reader;
        Json::Value parsed;
        if (!reader.parse(text, parsed)) {
            return false;
        }
        value.swap(parsed);
        return true;
    } catch (const Json::Exception&) {
        return false;  // nested past the reader's limit, or out of memory
    }
}

std::string jsonText(const Json::Value& value) {
    Json::FastWriter writer;
    writer.omitEndingLineFeed();
    return writer.write(value);
}

#pragma GCC diagnostic pop

std::optional<std::string> readString(const Json::Value& value) {
    return value.isConvertibleTo(Json::stringValue) ? std::optional(value.asString()) : std::nullopt;
}

std::optional<bool> readBool(const Json::Value& value) {
    return value.isConvertibleTo(Json::booleanValue) ? std::optional(value.asBool()) : std::nullopt;
}

}  // namespace TERN::HA::Daemon
