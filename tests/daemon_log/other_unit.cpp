#include "daemon_log/other_unit.h"

#include "ha_log.h"

namespace test {

namespace {

struct EarlyObject {
    EarlyObject()
        : hasLogs(TERN::HA::Daemon::daemonLog != nullptr && TERN::HA::Daemon::recordLog != nullptr) {}
    bool hasLogs;
};

const EarlyObject early;

}  // namespace

TERN::HA::Daemon::DaemonLog* otherDaemonLog() {
    return TERN::HA::Daemon::daemonLog;
}

TERN::HA::Daemon::DaemonLog* otherRecordLog() {
    return TERN::HA::Daemon::recordLog;
}

void logFromOtherUnit(const char* message) {
    HA_LOG(message);
}

bool wereLogsReadyDuringInitialisation() {
    return early.hasLogs;
}

}  // namespace test
