#include "support/pattern.h"

#include <stdexcept>

namespace test {

Pattern::Pattern(const std::string& expression) {
    if (regcomp(&compiled_, expression.c_str(), REG_EXTENDED) != 0) {
        throw std::invalid_argument("no regular expression: " + expression);
    }
}

Pattern::~Pattern() {
    regfree(&compiled_);
}

std::vector<std::string> Pattern::find(const std::string& text) const {
    std::vector<regmatch_t> parts(compiled_.re_nsub + 1);
    std::vector<std::string> found;
    if (regexec(&compiled_, text.c_str(), parts.size(), parts.data(), 0) == 0) {
        for (const regmatch_t& part : parts) {
            const auto start = static_cast<size_t>(part.rm_so);
            found.push_back(part.rm_so == -1 ? ""
                                             : text.substr(start, static_cast<size_t>(part.rm_eo) - start));
        }
    }
    return found;
}

}  // namespace test
