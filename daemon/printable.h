#pragma once

#include <string>

namespace ternhad {

// Return `text` for a log or a terminal: without its newline, other control characters replaced by
// '?'.
inline std::string printable(std::string text) {
    while (!text.empty() && (text.back() == '\n' || text.back() == '\r')) {
        text.pop_back();
    }
    for (char& character : text) {
        const auto code = static_cast<unsigned char>(character);
        if (code < 0x20 || code == 0x7f) {
            character = '?';
        }
    }
    return text;
}

}  // namespace ternhad
