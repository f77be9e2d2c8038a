#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "event.h"
#include "events.h"
#include "health.h"
#include "options.h"

namespace ternhad {

// The daemon's side of the log keeper, the process that moves and rotates the logs and takes
// snapshots, so that a hung disk or program hangs only that process. One request is in progress at
// a time. A keeper that exits is restarted; one that hangs is killed, abandoned and replaced. Only
// finish() blocks. To be called from the thread that created it: the keeper is killed when that
// thread ends.
class LogKeeper {
 public:
    LogKeeper(const Options& options, Health& health, Events& events);
    ~LogKeeper();

    LogKeeper(const LogKeeper&) = delete;
    LogKeeper& operator=(const LogKeeper&) = delete;

    // Start the process; the first time before any thread or socket exists. Returns false with
    // errno.
    bool start();

    void wantSnapshot() { _isSnapshotWanted = true; }
    void wantRotation() { _isRotationWanted = true; }

    // Poll this descriptor, unless negative, and call work() when it is readable, after SIGCHLD, and
    // at workTime(). A reply is only waited for if the next request is due: that saves a wake-up for
    // each request.
    int fd() const { return _busySince && isNextDue() ? _replies : -1; }
    void work();
    Clock::time_point workTime() const;

    // Let the keeper move the logs a last time and exit, both by `deadline`.
    void finish(Clock::time_point deadline);

 private:
    bool isNextDue() const;
    Clock::time_point hangTime() const;
    void reap();
    void replaceIfHanging();
    void sendNext();
    bool send(const std::string& request);
    bool isDoneBy(Clock::time_point deadline);
    void takeReply();
    void leaveBehind(int signal);
    void closePipes();

    const Options& _options;
    Health& _health;
    Events& _events;
    std::string _program;

    pid_t _process = -1;
    std::vector<pid_t> _leftBehind;  // killed, but still in the kernel
    int _requests = -1;
    int _replies = -1;
    std::optional<Clock::time_point> _busySince;
    Clock::time_point _nextStart;
    Clock::time_point _nextMove;
    Clock::time_point _nextSnapshot;
    bool _isSnapshotWanted = false;
    bool _isRotationWanted = false;
};

// Requests, one packet each, on the keeper's standard input. The keeper writes a byte to its
// standard output for each completed one.
enum class LogRequest : char {
    move = 'm',      // move buffered lines to disk; rotate a log that reached its limit
    rotate = 'r',    // the same, and rotate both logs
    snapshot = 's',  // followed by the status as JSON: record it, processes, file systems and memory
    finish = 'q',    // move and exit
};

// Argument that makes this program the keeper, followed by the log size that triggers rotation.
constexpr char LOG_KEEPER[] = "--log-keeper";

// Main function of the keeper. Returns the exit code.
int keepLogs(std::int64_t rotateSize);

}  // namespace ternhad
