#pragma once

#include <functional>
#include <vector>

namespace test {

// While the object lives, sleep() returns at once after calling `onSleep` with the number of the call,
// from 1.
class FastSleep {
 public:
    explicit FastSleep(std::function<void(int)> onSleep);
    ~FastSleep();

    FastSleep(const FastSleep&) = delete;
    FastSleep& operator=(const FastSleep&) = delete;

    // What was asked for, in seconds.
    static std::vector<unsigned int> sleeps();
};

}  // namespace test
