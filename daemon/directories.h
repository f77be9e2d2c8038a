#pragma once

#include <string>

namespace ternhad {

// Makes the directories that the library writes to and that of the control socket (`socketPath`), mode 0700,
// where they are missing. /tmp/ha must be a real directory of this user that nobody else can write to,
// with nothing in it but this user's files: anybody can put something of that name into /tmp. Returns false
// after a message on standard error.
bool prepareDirectories(const char* socketPath);

// Lets others pass through the directory of the status socket, without listing it, where it is the daemon's
// own or made here. Writes a message to standard error when that fails.
void openStatusDirectory(const std::string& socketPath);

}  // namespace ternhad
