#pragma once

#include <sys/types.h>

#include <chrono>
#include <string>
#include <thread>

#include "support/files.h"

namespace test {

/// Poll `predicate`, at least once, until it holds or `deadline` has passed on the monotonic clock.
/// Return whether it held.
template <typename Predicate>
bool eventually(std::chrono::milliseconds deadline, Predicate&& predicate) {
    constexpr std::chrono::milliseconds INTERVAL{3};
    const auto end = std::chrono::steady_clock::now() + deadline;
    while (!predicate()) {
        if (std::chrono::steady_clock::now() >= end) {
            return false;
        }
        std::this_thread::sleep_for(INTERVAL);
    }
    return true;
}

/// Return whether a thread of this process is blocked in the kernel.
inline bool isAsleep(pid_t thread) {
    const std::string stat = readFile("/.kernel/proc/self/task/" + std::to_string(thread) + "/stat");
    return stat.find(") S ") != std::string::npos;
}

/// Measures the time since its construction on the monotonic clock.
class Stopwatch {
 public:
    std::chrono::nanoseconds elapsed() const { return std::chrono::steady_clock::now() - _start; }

 private:
    std::chrono::steady_clock::time_point _start = std::chrono::steady_clock::now();
};

}  // namespace test
