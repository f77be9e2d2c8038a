#pragma once

#include <sys/types.h>

#include "options.h"

namespace ternhad {

// Return the mode with which the directory of the control socket is created: 0711, which lets other
// users search but not list it, if the status socket is in it, too, otherwise 0700.
mode_t socketDirectoryMode(const Options& options);
constexpr mode_t STATUS_DIRECTORY_MODE = 0711;

// Create the directories of the logs with mode 0700, and that of the control socket, if they are
// missing. /tmp/ha must be a real directory that this user owns and nobody else can write to, with
// only this user's files in it, because any user can create it. Returns false after a message on
// standard error.
bool prepareDirectories(const Options& options);

// Allow other users to search the daemon's own directory if the status socket is in it. Prints a
// message to standard error on failure.
void openStatusDirectory(const Options& options);

}  // namespace ternhad
