#pragma once

#include <chrono>
#include <ctime>
#include <functional>
#include <vector>

/// Clocks of the library under test: interposes functions of the C library.
namespace test {

/// Makes time() return `now` for the lifetime of the object.
class FixedTime {
 public:
    explicit FixedTime(std::time_t now);
    ~FixedTime();

    FixedTime(const FixedTime&) = delete;
    FixedTime& operator=(const FixedTime&) = delete;
};

/// Step the wall clock by `step`, which may be negative, after the next time that the process reads
/// it.
void stepClockAfterNextRead(std::chrono::seconds step);

/// Makes nanosleep() return immediately for the lifetime of the object.
class NoSleep {
 public:
    NoSleep();
    ~NoSleep();

    NoSleep(const NoSleep&) = delete;
    NoSleep& operator=(const NoSleep&) = delete;

    /// Return the sum of the requested sleeps.
    static std::chrono::milliseconds total();
};

/// Return how often the process has read the machine's time zone.
int timeZoneReads();

/// Makes sleep() return immediately after calling `onSleep` with the number of the call, counted
/// from 1.
class FastSleep {
 public:
    explicit FastSleep(std::function<void(int)> onSleep);
    ~FastSleep();

    FastSleep(const FastSleep&) = delete;
    FastSleep& operator=(const FastSleep&) = delete;

    /// Return the requested sleeps in seconds.
    static std::vector<unsigned int> sleeps();
};

}  // namespace test
