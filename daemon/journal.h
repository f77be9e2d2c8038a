#pragma once

#include <string>

namespace ternhad {

// Priorities of syslog(3).
enum class Level { warning = 4, notice = 5 };

// Write a line to standard error, prefixed with the priority if that is the journal. Blocks while
// the reader does not read.
void writeJournal(Level level, const std::string& text);

}  // namespace ternhad
