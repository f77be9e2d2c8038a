#pragma once

#include "daemon_log.h"

// A second source file with a pair of log objects of its own.
namespace test {

TERN::HA::Daemon::DaemonLog* otherDaemonLog();
TERN::HA::Daemon::DaemonLog* otherRecordLog();

// Logs through this file's own object.
void logFromOtherUnit(const char* message);

// Whether this file's log objects were there when its own static objects were made.
bool wereLogsReadyDuringInitialisation();

}  // namespace test
