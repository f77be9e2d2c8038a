#include "text.h"

#include <algorithm>
#include <cerrno>

namespace TERN::HA::Daemon {

std::string_view readLine(std::FILE* stream, Line& line) {
    std::size_t size = 0;
    while (size < line.size() - 1) {
        const int byte = getc_unlocked(stream);
        if (byte != EOF) {
            line[size++] = static_cast<char>(byte);
            if (byte == '\n') {
                break;
            }
        } else if (std::ferror(stream) != 0 && errno == EINTR) {
            std::clearerr(stream);
        } else {
            break;
        }
    }
    line[size] = '\0';
    return {line.data(), size};
}

std::vector<std::string> split(std::string_view line) {
    constexpr std::string_view BLANKS = " \t\n\v\f\r";
    std::vector<std::string> tokens;
    std::size_t begin = 0;
    while ((begin = line.find_first_not_of(BLANKS, begin)) != std::string_view::npos) {
        const std::size_t end = std::min(line.find_first_of(BLANKS, begin), line.size());
        tokens.emplace_back(line.substr(begin, end - begin));
        begin = end;
    }
    return tokens;
}

bool startsWith(std::string_view text, std::string_view prefix) {
    return text.substr(0, prefix.size()) == prefix;
}

}  // namespace TERN::HA::Daemon
