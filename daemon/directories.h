#pragma once

#include <sys/types.h>

#include "options.h"

namespace ternhad {

// The mode of the control socket's directory where it is made: 0711, so that others pass through without
// listing it, when the status socket is in it, too; else 0700.
mode_t socketDirectoryMode(const Options& options);
constexpr mode_t STATUS_DIRECTORY_MODE = 0711;

// Makes the directories that the library writes to, mode 0700, and that of the control socket where they are
// missing. /tmp/ha must be a real directory of this user that nobody else can write to,
// with nothing in it but this user's files: anybody can put something of that name into /tmp. Returns false
// after a message on standard error.
bool prepareDirectories(const Options& options);

// Lets others pass through the daemon's own directory when the status socket is in it. Writes a message to
// standard error when that fails.
void openStatusDirectory(const Options& options);

}  // namespace ternhad
