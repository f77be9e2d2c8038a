#pragma once

#include <CLI/CLI.hpp>
#include <map>
#include <string>
#include <vector>

namespace ternhad {

// The format of the configuration file, a line NAME = VALUE each. Knows in which line each name stands, so
// that messages about wrong values can tell.
class ConfigFile : public CLI::ConfigINI {
 public:
    explicit ConfigFile(const CLI::App& app) : _app(app) {}

    std::vector<CLI::ConfigItem> from_config(std::istream& input) const override;

    // "FILE:LINE: NAME = VALUE: reason" when `error` is about something in the file, "FILE: reason" when it
    // is about the file or what it lacks; otherwise empty. `arguments`: of the command line, whose options
    // win.
    std::string located(const CLI::ParseError& error, const std::vector<std::string>& arguments) const;

 private:
    struct Line {
        int number;
        std::string text;
    };

    void scan(const std::string& text) const;
    std::string path() const;

    const CLI::App& _app;
    mutable std::map<std::string, Line> _lines;  // by name; from_config() must be const
};

}  // namespace ternhad
