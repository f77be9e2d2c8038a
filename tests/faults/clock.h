#pragma once

#include <chrono>
#include <ctime>
#include <functional>
#include <vector>

/// The clocks of the library under test: put in front of the C library's functions.
namespace test {

/// While the object lives, time() is `now`.
class FixedTime {
 public:
    explicit FixedTime(std::time_t now);
    ~FixedTime();

    FixedTime(const FixedTime&) = delete;
    FixedTime& operator=(const FixedTime&) = delete;
};

/// The wall clock is set forward by `step`, back when that is negative, right after the process has looked at
/// it for the next time.
void stepClockAfterNextLook(std::chrono::seconds step);

/// While the object lives, nanosleep() returns at once.
class NoSleep {
 public:
    NoSleep();
    ~NoSleep();

    NoSleep(const NoSleep&) = delete;
    NoSleep& operator=(const NoSleep&) = delete;

    /// How long these sleeps should have been, together.
    static std::chrono::milliseconds total();
};

/// How often the process has looked at the machine's time zone.
int zoneLooks();

/// While the object lives, sleep() returns at once after calling `onSleep` with the number of the call,
/// from 1.
class FastSleep {
 public:
    explicit FastSleep(std::function<void(int)> onSleep);
    ~FastSleep();

    FastSleep(const FastSleep&) = delete;
    FastSleep& operator=(const FastSleep&) = delete;

    /// What was asked for, in seconds.
    static std::vector<unsigned int> sleeps();
};

}  // namespace test
