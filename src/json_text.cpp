#include "json_text.h"

namespace TERN::HA::Daemon {

// jsoncpp calls both classes deprecated in favour of builders that read their settings from a map on every
// use and accept other texts.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"

bool parseJson(const std::string& text, Json::Value& value) {
    try {
        Json::Reader reader;
        Json::Value parsed;
        if (!reader.parse(text, parsed, true)) {
            return false;
        }
        value.swap(parsed);
        return true;
    } catch (const Json::Exception&) {
        return false;  // nested past the reader's limit
    }
}

std::string jsonText(const Json::Value& value) {
    Json::FastWriter writer;
    writer.omitEndingLineFeed();
    return writer.write(value);
}

#pragma GCC diagnostic pop

bool readString(const Json::Value& value, std::string& result) {
    if (!value.isConvertibleTo(Json::stringValue)) {
        return false;
    }
    result = value.asString();
    return true;
}

bool readBool(const Json::Value& value, bool& result) {
    if (!value.isConvertibleTo(Json::booleanValue)) {
        return false;
    }
    result = value.asBool();
    return true;
}

}  // namespace TERN::HA::Daemon
