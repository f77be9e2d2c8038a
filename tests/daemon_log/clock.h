#pragma once

#include <chrono>
#include <ctime>

namespace test {

// Makes the library believe that it is `now`, for as long as the object lives.
class FixedTime {
 public:
    explicit FixedTime(std::time_t now);
    ~FixedTime();

    FixedTime(const FixedTime&) = delete;
    FixedTime& operator=(const FixedTime&) = delete;
};

// While the object lives, sleeps of this process end at once.
class NoSleep {
 public:
    NoSleep();
    ~NoSleep();

    NoSleep(const NoSleep&) = delete;
    NoSleep& operator=(const NoSleep&) = delete;

    // How long they should have been, together.
    static std::chrono::milliseconds total();
};

// How often the process has looked at the machine's time zone.
int zoneLooks();

}  // namespace test
