#include "config_file.h"

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>

namespace ternhad {

namespace {

constexpr char BYTE_ORDER_MARK[] = "\xEF\xBB\xBF";

// An error in the file whose message already has its location.
class LocatedError : public CLI::ConfigError {
 public:
    LocatedError(const std::string& place, const std::string& reason)
        : ConfigError("ConfigError", place + reason, CLI::ExitCodes::ConfigError) {}
};

bool isGiven(const std::string& option, const std::vector<std::string>& arguments) {
    return std::any_of(arguments.begin(), arguments.end(), [&option](const std::string& argument) {
        return argument == option || argument.rfind(option + '=', 0) == 0;
    });
}

// Return whether `text` names the option, and not one whose longer name begins with it.
bool names(const std::string& text, const std::string& option) {
    const std::size_t place = text.find(option);
    if (place == std::string::npos) {
        return false;
    }
    const std::size_t end = place + option.size();
    return end == text.size() ||
           (std::isalnum(static_cast<unsigned char>(text[end])) == 0 && text[end] != '-');
}

// Return what is wrong with the blanks in a value, or null. It may contain everything in quotes.
const char* mistakeIn(const std::string& value) {
    const std::string trimmed = CLI::detail::trim_copy(value);
    if (trimmed.empty() || trimmed.front() == '"' || trimmed.front() == '\'') {
        return nullptr;
    }
    const std::size_t mark = value.find_first_of("#;");
    if (mark != std::string::npos &&
        (mark == 0 || std::isspace(static_cast<unsigned char>(value[mark - 1])) != 0)) {
        return "a comment needs a line of its own: ";
    }
    return trimmed.find_first_of(" \t") != std::string::npos ? "a value with blanks needs quotes: " : nullptr;
}

// Return why the file cannot be read. A directory can be opened, but not read.
std::string reasonOf(const std::string& path) {
    errno = 0;
    std::ifstream(path).peek();
    return std::strerror(errno);
}

}  // namespace

std::string ConfigFile::path() const {
    const CLI::Option* const option = _app.get_config_ptr();
    return option->count() == 0 ? std::string() : option->results().back();
}

void ConfigFile::scan(const std::string& text) const {
    if (text.rfind(BYTE_ORDER_MARK, 0) == 0) {
        throw LocatedError(path() + ":1: ", "the file begins with a byte order mark: save it without one");
    }
    std::istringstream input(text);
    std::string line;
    for (int number = 1; std::getline(input, line); ++number) {
        line = CLI::detail::trim_copy(line);
        if (line.empty() || line.front() == '#' || line.front() == ';') {
            continue;
        }
        const std::string place = path() + ':' + std::to_string(number) + ": ";
        const std::size_t equals = line.find('=');
        if (equals == std::string::npos || line.front() == '[') {
            throw LocatedError(place, "not NAME = VALUE: " + line);
        }
        const std::string name = CLI::detail::trim_copy(line.substr(0, equals));
        const CLI::Option* const option = _app.get_option_no_throw("--" + name);
        if (name.empty() || option == nullptr || !option->get_configurable()) {
            throw LocatedError(place, "unknown name: " + name);
        }
        if (const char* const mistake = mistakeIn(line.substr(equals + 1))) {
            throw LocatedError(place, mistake + line);
        }
        const auto [known, isNew] = _lines.insert({name, {number, line}});
        if (!isNew) {
            throw LocatedError(place,
                               name + " stands in line " + std::to_string(known->second.number) + " already");
        }
    }
}

std::vector<CLI::ConfigItem> ConfigFile::from_config(std::istream& input) const {
    std::ostringstream text;
    text << input.rdbuf();
    scan(text.str());
    std::istringstream again(text.str());
    return ConfigINI::from_config(again);
}

std::string ConfigFile::located(const CLI::ParseError& error,
                                const std::vector<std::string>& arguments) const {
    std::string text = error.what();
    if (dynamic_cast<const LocatedError*>(&error) != nullptr) {
        return text;
    }
    if (dynamic_cast<const CLI::FileError*>(&error) != nullptr) {
        return path() + ": " + reasonOf(path());
    }
    // Prefer the option that begins the message to others that it mentions.
    for (const bool isSubject : {true, false}) {
        for (const auto& [name, line] : _lines) {
            const std::string option = "--" + name;
            if (isGiven(option, arguments) ||
                !(isSubject ? text.rfind(option + ": ", 0) == 0 : names(text, option))) {
                continue;
            }
            text.erase(0, isSubject ? option.size() + 2 : 0);
            return path() + ':' + std::to_string(line.number) + ": " + line.text + ": " + text;
        }
    }
    const bool isMissing = dynamic_cast<const CLI::RequiredError*>(&error) != nullptr;
    return isMissing && !path().empty() ? path() + ": " + text : std::string();
}

}  // namespace ternhad
