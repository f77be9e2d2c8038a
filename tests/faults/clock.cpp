#include "faults/clock.h"

#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <utility>

#include "faults/real_function.h"

namespace {

#ifdef SYS_clock_gettime64
constexpr long CLOCK_GETTIME = SYS_clock_gettime64;
#else
constexpr long CLOCK_GETTIME = SYS_clock_gettime;
#endif

std::atomic<std::time_t> fixedTime{0};
std::atomic<std::time_t> nextStep{0};
std::atomic<bool> isSleepless{false};
std::atomic<std::chrono::nanoseconds> slept{std::chrono::nanoseconds(0)};
std::atomic<int> looks{0};
std::function<void(int)> hook;
std::vector<unsigned int> asked;

}  // namespace

// Interposed for every library of the process.

int clock_gettime(clockid_t clock, timespec* now) noexcept {
    const int result = static_cast<int>(syscall(CLOCK_GETTIME, clock, now));
    if (clock == CLOCK_REALTIME) {
        now->tv_sec -= nextStep.exchange(0);
    }
    return result;
}

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

unsigned int sleep(unsigned int seconds) {
    static auto* const real = test::realFunction<unsigned int(unsigned int)>("sleep");
    if (!hook) {
        return real(seconds);
    }
    asked.push_back(seconds);
    hook(static_cast<int>(asked.size()));
    return 0;
}

namespace test {

FixedTime::FixedTime(std::time_t now) {
    fixedTime = now;
}

FixedTime::~FixedTime() {
    fixedTime = 0;
}

void stepClockAfterNextRead(std::chrono::seconds step) {
    nextStep = step.count();
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

int timeZoneReads() {
    return looks;
}

FastSleep::FastSleep(std::function<void(int)> onSleep) {
    asked.clear();
    hook = std::move(onSleep);
}

FastSleep::~FastSleep() {
    hook = nullptr;
}

std::vector<unsigned int> FastSleep::sleeps() {
    return asked;
}

}  // namespace test
