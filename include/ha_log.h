/// @file
/// Log objects of a source file, and the macro that logs through them.

#pragma once

#include <new>
#include <string>

#include "daemon_log.h"

// Every name here has internal linkage: each source file that includes this header owns a pair of
// log objects, and all pairs name the same files. A mutex therefore serialises the callers of one
// source file only. The objects are created by static initialisation and never freed, so that
// logging works until the process exits; "used" keeps the pointers alive in files that never log,
// so that leak checkers stay quiet.

namespace TERN::HA::Daemon {

constexpr char LOG_DIR[] = "/var/log/ha";                   ///< directory of the persistent logs
constexpr char DAEMON_LOG_FILE[] = "/ha.daemon.log";        ///< file name of daemonLog
constexpr char DAEMON_RECORD_FILE[] = "/ha.daemon.record";  ///< file name of recordLog

// Frozen: docs/compatibility.md#log-objects-per-source-file
/// Diagnostic messages of this source file.
[[gnu::used]] static DaemonLog* const daemonLog = new DaemonLog(LOG_DIR, DAEMON_LOG_FILE);

/// Diagnostic snapshots: status, processes, file systems, memory.
[[gnu::used]] static DaemonLog* const recordLog = new DaemonLog(LOG_DIR, DAEMON_RECORD_FILE);

/// Log "file:line message" to daemonLog. Call it through HA_LOG, which passes its call site.
[[maybe_unused]] static void logAt(const char* file, int line, const std::string& message) {
    daemonLog->set(std::string(file) + ":" + std::to_string(line) + " " + message);
}

}  // namespace TERN::HA::Daemon

/// Log "file.cpp:LINE message" with file and line of the call site. `message` is a std::string or a
/// literal. Blocks as DaemonLog::set does. Never throws std::bad_alloc: the line is dropped when
/// memory runs out.
#define HA_LOG(message)                                                    \
    do {                                                                   \
        try {                                                              \
            ::TERN::HA::Daemon::logAt(__FILE_NAME__, __LINE__, (message)); \
        } catch (const std::bad_alloc&) {                                  \
        }                                                                  \
    } while (false)
