#include "daemon_log/clock.h"

#include <atomic>

namespace {

std::atomic<std::time_t> fixedTime{0};

}  // namespace

// The dynamic linker takes this one before that of the C library, for every library of the process.
std::time_t time(std::time_t* result) noexcept {
    std::time_t now = fixedTime;
    if (now == 0) {
        timespec clock = {};
        clock_gettime(CLOCK_REALTIME, &clock);
        now = clock.tv_sec;
    }
    if (result != nullptr) {
        *result = now;
    }
    return now;
}

namespace test {

FixedTime::FixedTime(std::time_t now) {
    fixedTime = now;
}

FixedTime::~FixedTime() {
    fixedTime = 0;
}

}  // namespace test
