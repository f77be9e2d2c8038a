#include "daemon_log/clock.h"

#include <atomic>

#include "support/real_function.h"

namespace {

std::atomic<std::time_t> fixedTime{0};
std::atomic<bool> isSleepless{false};
std::atomic<std::chrono::nanoseconds> slept{std::chrono::nanoseconds(0)};
std::atomic<int> looks{0};

}  // namespace

// The dynamic linker takes these before those of the C library, for every library of the process.
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

int nanosleep(const timespec* time, timespec* rest) {
    static auto* const real =
        test::realFunction<int(const timespec*, timespec*)>("nanosleep", "__nanosleep64");
    if (!isSleepless) {
        return real(time, rest);
    }
    slept = slept.load() + std::chrono::seconds(time->tv_sec) + std::chrono::nanoseconds(time->tv_nsec);
    return 0;
}

void tzset() noexcept {
    static auto* const real = test::realFunction<void()>("tzset");
    ++looks;
    real();
}

namespace test {

FixedTime::FixedTime(std::time_t now) {
    fixedTime = now;
}

FixedTime::~FixedTime() {
    fixedTime = 0;
}

NoSleep::NoSleep() {
    slept = std::chrono::nanoseconds(0);
    isSleepless = true;
}

NoSleep::~NoSleep() {
    isSleepless = false;
}

std::chrono::milliseconds NoSleep::total() {
    return std::chrono::duration_cast<std::chrono::milliseconds>(slept.load());
}

int zoneLooks() {
    return looks;
}

}  // namespace test
