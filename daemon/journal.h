#pragma once

#include <string>

namespace ternhad {

// As syslog(3) numbers them.
enum class Level { warning = 4, notice = 5 };

// Writes a line to standard error, for the service's journal; with the level in front where that is what
// standard error is. Blocks while the reader does not read.
void writeJournal(Level level, const std::string& text);

}  // namespace ternhad
