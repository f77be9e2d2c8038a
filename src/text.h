#pragma once

#include <array>
#include <cstdio>
#include <string>
#include <string_view>
#include <vector>

namespace TERN::HA::Daemon {

using Line = std::array<char, 512>;

// Return the next line of `stream` with its newline, at most 511 bytes of it; empty at the end.
// Unlike fgets, it continues after an interruption.
std::string_view readLine(std::FILE* stream, Line& line);

// Split at blanks. A stream would treat an allocation failure as the end of the line.
std::vector<std::string> split(std::string_view line);

bool startsWith(std::string_view text, std::string_view prefix);

}  // namespace TERN::HA::Daemon
