#pragma once

#include <CLI/CLI.hpp>
#include <map>
#include <string>
#include <vector>

namespace ternhad {

// Parser of the configuration file, one NAME = VALUE per line. Remembers the line of each name for
// error messages.
class ConfigFile : public CLI::ConfigINI {
 public:
    explicit ConfigFile(const CLI::App& app) : _app(app) {}

    std::vector<CLI::ConfigItem> from_config(std::istream& input) const override;

    // Return "FILE:LINE: NAME = VALUE: reason" for an error in the file, "FILE: reason" if the file
    // cannot be read or lacks a setting, and the empty string for an error on the command line.
    // `arguments`: the command line, which takes precedence over the file.
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
