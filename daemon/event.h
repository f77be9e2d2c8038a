#pragma once

#include <poll.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <initializer_list>

namespace ternhad {

using Clock = std::chrono::steady_clock;

// A flag that a thread can wait for, alone or together with sockets. Thread-safe; set() neither
// blocks nor allocates.
class Event {
 public:
    // Throws std::system_error if no descriptor is available, and std::logic_error after seal().
    Event();
    ~Event();

    // Forbid the creation of further events. To be called before a thread isolates its descriptor
    // table: there, the descriptor number of a later event would refer to another file.
    static void seal() noexcept;

    Event(const Event&) = delete;
    Event& operator=(const Event&) = delete;

    void set() noexcept;

    // Clear the flag; return whether it was set.
    bool take() noexcept;

    // Readable while the flag is set.
    int fd() const noexcept { return _fd; }

 private:
    int _fd;
};

// Stop request to all threads of the daemon.
class Shutdown {
 public:
    void request(int exitCode) noexcept;

    // True once the stop is requested: discard the result of a check that it may have interrupted.
    bool isRequested() const noexcept { return _isRequested; }
    int exitCode() const noexcept { return _exitCode; }

    const Event& event() const noexcept { return _event; }

    // Sleep until `time`, or until one of `others` is set. Returns false once the stop is
    // requested.
    bool sleepUntil(Clock::time_point time, std::initializer_list<const Event*> others = {}) const noexcept;

    // Sleep until `event` is set, for a day at most. Returns false once the stop is requested.
    bool waitFor(const Event& event) const noexcept;

 private:
    Event _event;
    std::atomic<bool> _isRequested{false};
    std::atomic<int> _exitCode{0};
};

// Return the start of the round after the one scheduled for `round`; rounds already missed are
// skipped.
Clock::time_point nextRound(Clock::time_point round, std::chrono::duration<double> interval) noexcept;

// Wait like poll() until `time`, rounded up to a millisecond, or for 24 days at most. Return its
// result.
int pollUntil(Clock::time_point time, pollfd* waits, std::size_t count) noexcept;

}  // namespace ternhad
