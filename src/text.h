#pragma once

#include <array>
#include <cstdio>
#include <string>
#include <string_view>
#include <vector>

namespace TERN::HA::Daemon {

using Line = std::array<char, 512>;

// The next line of `stream`, or the next 511 bytes of a longer one, with its newline; empty at the end. Like
// fgets, for which a signal would be the end.
std::string_view readLine(std::FILE* stream, Line& line);

// The words between blanks. Not by a stream, which would take a lack of memory for the end of the line.
std::vector<std::string> split(std::string_view line);

bool startsWith(std::string_view text, std::string_view prefix);

}  // namespace TERN::HA::Daemon
