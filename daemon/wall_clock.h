#pragma once

#include <chrono>
#include <ctime>

namespace ternhad {

// Return the wall clock, read from the kernel: that of the standard library fails after 2038 on
// 32-bit machines.
inline std::chrono::system_clock::time_point wallClock() noexcept {
    timespec now = {};
    (void)clock_gettime(CLOCK_REALTIME, &now);  // cannot fail
    return std::chrono::system_clock::time_point(
        std::chrono::duration_cast<std::chrono::system_clock::duration>(
            std::chrono::seconds(now.tv_sec) + std::chrono::nanoseconds(now.tv_nsec)));
}

// Seconds since 1970.
inline double secondsOf(std::chrono::system_clock::time_point time) noexcept {
    return std::chrono::duration<double>(time.time_since_epoch()).count();
}

}  // namespace ternhad
