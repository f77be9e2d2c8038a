#pragma once

#include "daemon_log.h"

// A second source file, with its own pair of log objects.
namespace test {

TERN::HA::Daemon::DaemonLog* otherDaemonLog();
TERN::HA::Daemon::DaemonLog* otherRecordLog();

// Log through this file's log object.
void logFromOtherUnit(const char* message);

// Return whether this file's log objects existed when its other static objects were constructed.
bool wereLogsReadyDuringInitialisation();

}  // namespace test
