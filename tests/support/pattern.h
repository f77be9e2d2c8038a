#pragma once

#include <regex.h>

#include <string>
#include <vector>

namespace test {

/// A POSIX extended regular expression.
class Pattern {
 public:
    /// Throws std::invalid_argument when the expression is none.
    explicit Pattern(const std::string& expression);
    Pattern(const Pattern&) = delete;
    Pattern& operator=(const Pattern&) = delete;
    ~Pattern();

    /// The first match in `text`, followed by its groups; empty when there is no match.
    std::vector<std::string> find(const std::string& text) const;

 private:
    regex_t compiled_{};
};

}  // namespace test
