/// @file
/// The two logs of every source file.

#pragma once

#include <string>

#include "daemon_log.h"

// The two logs, for every source file that includes this header. All names here have internal linkage: each
// source file owns a pair of log objects, so that one file's lines never wait for another's. All pairs name
// the same files. The objects are made while the program or library is loaded and are never freed, so that
// lines can still be logged while it is being torn down; "used" keeps the pointers, and so the objects from
// counting as leaks, in files that never log.

namespace TERN::HA::Daemon {

constexpr char LOG_DIR[] = "/var/log/ha";                   ///< where the persistent logs are
constexpr char DAEMON_LOG_FILE[] = "/ha.daemon.log";        ///< daemonLog's
constexpr char DAEMON_RECORD_FILE[] = "/ha.daemon.record";  ///< recordLog's

/// Diagnostic messages.
[[gnu::used]] static DaemonLog* const daemonLog = new DaemonLog(LOG_DIR, DAEMON_LOG_FILE);

/// Snapshots of status, processes, file systems and memory.
[[gnu::used]] static DaemonLog* const recordLog = new DaemonLog(LOG_DIR, DAEMON_RECORD_FILE);

/// Use HA_LOG: it passes the place of its call.
[[maybe_unused]] static void logAt(const char* file, int line, const std::string& message) {
    daemonLog->set(std::string(file) + ":" + std::to_string(line) + " " + message);
}

}  // namespace TERN::HA::Daemon

/// Logs "file.cpp:LINE message" to the including source file's daemonLog. `message` is a std::string or text.
#define HA_LOG(message) ::TERN::HA::Daemon::logAt(__FILE_NAME__, __LINE__, (message))
