#include <fcntl.h>
#include <malloc.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <syslog.h>
#include <unistd.h>

#include <array>
#include <climits>
#include <csignal>
#include <string>

#include "checker.h"
#include "ha_log.h"
#include "log_keeper.h"
#include "passes.h"

namespace ternhad {

using TERN::HA::Daemon::DaemonLog;
using TERN::HA::Daemon::daemonLog;
using TERN::HA::Daemon::LOG_DIR;
using TERN::HA::Daemon::recordLog;

namespace {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
// A sanitizer's memory counts, too, and exceeds any limit.
constexpr rlim_t SNAPSHOT_MEMORY = RLIM_INFINITY;
#else
constexpr rlim_t SNAPSHOT_MEMORY = 64UL << 20;  // bytes
#endif

// Move a log to disk; rotate it if it has reached its limit.
class Mover {
 public:
    Mover(DaemonLog& log, std::int64_t rotateSize) : _log(log), _rotateSize(rotateSize) {}

    // Returns whether anything was written to the disk.
    bool move(bool rotateNow) {
        const std::int64_t before = _log.size();
        _log.writeLogToDisk();
        if (rotateNow || _log.size() >= _nextRotation) {
            _log.rotate();
            // If the compression failed, the log stays large, and each further attempt drops an
            // archive.
            _nextRotation = _log.size() + _rotateSize;
            return true;
        }
        return _log.size() != before;
    }

 private:
    DaemonLog& _log;
    std::int64_t _rotateSize;
    std::int64_t _nextRotation = _rotateSize;
};

// Otherwise a loss of power would take lines that had been moved half a minute before.
void flushDisk() {
    const int directory = open(LOG_DIR, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (directory >= 0) {
        (void)syncfs(directory);
        close(directory);
    }
}

void limitMemory(rlim_t bytes) {
    rlimit limit = {};
    getrlimit(RLIMIT_DATA, &limit);
    limit.rlim_cur = std::min(bytes, limit.rlim_max);
    setrlimit(RLIMIT_DATA, &limit);
}

// Skip a snapshot that does not fit into the memory limit.
void recordSnapshot(const std::string& status) {
    limitMemory(SNAPSHOT_MEMORY);
    attempt([&status] { recordLog->set("\n" + status); });
    attempt(TERN::HA::Daemon::recordPS);
    attempt(TERN::HA::Daemon::recordDF);
    attempt(TERN::HA::Daemon::recordMemoryInfo);
    limitMemory(RLIM_INFINITY);
    (void)malloc_trim(0);  // there may be nothing to give back
}

}  // namespace

int keepLogs(std::int64_t rotateSize) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    prctl(PR_SET_NAME, "ternhad-logs");
    openlog("ternhad", LOG_PID, LOG_DAEMON);
    Mover daemonMover(*daemonLog, rotateSize);
    Mover recordMover(*recordLog, rotateSize);
    const auto moveBoth = [&](bool rotateNow) {
        bool hasWritten = false;
        for (Mover* mover : {&daemonMover, &recordMover}) {
            attempt([&] { hasWritten |= mover->move(rotateNow); });
        }
        if (hasWritten) {
            flushDisk();
        }
    };
    std::array<char, PIPE_BUF> request;
    for (;;) {
        const ssize_t size = read(STDIN_FILENO, request.data(), request.size());
        if (size <= 0) {
            return 0;  // the daemon closed the pipe
        }
        const auto kind = static_cast<LogRequest>(request[0]);
        if (kind == LogRequest::snapshot) {
            recordSnapshot(std::string(&request[1], static_cast<std::size_t>(size - 1)));
        } else {
            moveBoth(kind == LogRequest::rotate);
        }
        if (write(STDOUT_FILENO, "d", 1) != 1 || kind == LogRequest::finish) {
            return 0;
        }
    }
}

}  // namespace ternhad
