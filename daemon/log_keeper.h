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

// The daemon's end of the log keeper: the process that moves, rotates and records, so that a disk or program
// that hangs hangs there. One request is under way at a time. A keeper that dies is started again, one that
// hangs is left behind and replaced. Blocks in finish() only. Call from the thread that made it: the keeper
// dies with that thread.
class LogKeeper {
 public:
    LogKeeper(const Options& options, Health& health, Events& events);
    ~LogKeeper();

    LogKeeper(const LogKeeper&) = delete;
    LogKeeper& operator=(const LogKeeper&) = delete;

    // Makes the process. The first time before there are threads and sockets. False with errno.
    bool start();

    void wantSnapshot() { _isSnapshotWanted = true; }
    void wantRotation() { _isRotationWanted = true; }

    // Poll this, and call work() when it is readable, after SIGCHLD, and at workTime().
    int fd() const { return _replies; }
    void work();
    Clock::time_point workTime() const;

    // Has the logs moved a last time and ends the process, both by `deadline`.
    void finish(Clock::time_point deadline);

 private:
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
    std::vector<pid_t> _leftBehind;  // killed, and not gone yet
    int _requests = -1;
    int _replies = -1;
    std::optional<Clock::time_point> _busySince;
    Clock::time_point _nextStart;
    Clock::time_point _nextMove;
    Clock::time_point _nextSnapshot;
    bool _isSnapshotWanted = false;
    bool _isRotationWanted = false;
};

// The requests, one packet each, to the keeper's standard input. The keeper writes a byte to its standard
// output when it has done one.
enum class LogRequest : char {
    move = 'm',      // the buffered lines to disk; rotate what has grown
    rotate = 'r',    // the same, and rotate both logs
    snapshot = 's',  // followed by the status as JSON: record it, processes, file systems and memory
    finish = 'q',    // move and exit
};

// The argument by which this program becomes the keeper; the next one is the size of a log at which it is
// rotated.
constexpr char LOG_KEEPER[] = "--log-keeper";

// The keeper. Returns the exit code.
int keepLogs(std::int64_t rotateSize);

}  // namespace ternhad
