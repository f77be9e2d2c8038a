#pragma once

#include "settings.h"

// The commands. Each prints to standard output and throws NoAnswer if the daemon does not reply.
namespace ternhactl {

ExitCode status(const Settings& settings);
ExitCode rebooting(const Settings& settings);
ExitCode rebootPeer(const Settings& settings);
ExitCode disks(const Settings& settings);
ExitCode check(const Settings& settings);
ExitCode printMetrics(const Settings& settings);
ExitCode wait(const Settings& settings);
ExitCode events(const Settings& settings);

// Print to standard error that the daemon does not reply, and why.
void complain(const Settings& settings, const char* reason);

}  // namespace ternhactl
