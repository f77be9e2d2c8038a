#pragma once

#include <atomic>
#include <chrono>
#include <initializer_list>

namespace ternhad {

using Clock = std::chrono::steady_clock;

// A flag that a thread can wait for, alone or together with sockets. Thread-safe; set() neither blocks nor
// allocates.
class Event {
 public:
    // Throws std::system_error when no descriptor is to be had, and std::logic_error after seal().
    Event();
    ~Event();

    // Forbids further events. A thread that gets a descriptor table of its own calls this first: there, the
    // number of a later event would be another file or socket.
    static void seal() noexcept;

    Event(const Event&) = delete;
    Event& operator=(const Event&) = delete;

    void set() noexcept;

    // Clears the flag and returns whether it was set.
    bool take() noexcept;

    // Readable while the flag is set.
    int fd() const noexcept { return _fd; }

 private:
    int _fd;
};

// The daemon's end, announced to all its threads.
class Shutdown {
 public:
    void request(int exitCode) noexcept;

    // True from the request on: discard the result of a check that it may have interrupted.
    bool isRequested() const noexcept { return _isRequested; }
    int exitCode() const noexcept { return _exitCode; }

    const Event& event() const noexcept { return _event; }

    // Sleeps until `time`, or until one of `others` is set. False when the daemon ends.
    bool sleepUntil(Clock::time_point time, std::initializer_list<const Event*> others = {}) const noexcept;

    // Sleeps until `event` is set, a day at most. False when the daemon ends.
    bool waitFor(const Event& event) const noexcept;

 private:
    Event _event;
    std::atomic<bool> _isRequested{false};
    std::atomic<int> _exitCode{0};
};

// When the round after the one planned for `round` begins. Rounds that could not be kept are left out.
Clock::time_point nextRound(Clock::time_point round, std::chrono::duration<double> interval) noexcept;

// The time from now until `time` for ppoll; 0 when it has passed.
timespec timeUntil(Clock::time_point time) noexcept;

}  // namespace ternhad
