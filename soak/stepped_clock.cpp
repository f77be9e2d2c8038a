#include <dlfcn.h>
#include <sys/time.h>
#include <unistd.h>

#include <ctime>

// Preloaded into a node's programs: while the file is there, their wall clock is an hour ahead. The machine's
// own belongs to everybody on it, and no namespace has one.

namespace {

template <typename Function>
Function next(const char* name) {
    return reinterpret_cast<Function>(dlsym(RTLD_NEXT, name));
}

std::time_t step() {
    return access("/run/stepped-clock", F_OK) == 0 ? 3600 : 0;
}

}  // namespace

extern "C" int clock_gettime(clockid_t clock, timespec* now) noexcept {
    static const auto real = next<int (*)(clockid_t, timespec*)>("clock_gettime");
    const int result = real(clock, now);
    if (clock == CLOCK_REALTIME || clock == CLOCK_REALTIME_COARSE) {
        now->tv_sec += step();
    }
    return result;
}

extern "C" int gettimeofday(timeval* now, void* zone) noexcept {
    static const auto real = next<int (*)(timeval*, void*)>("gettimeofday");
    const int result = real(now, zone);
    now->tv_sec += step();
    return result;
}

extern "C" std::time_t time(std::time_t* result) noexcept {
    timespec now = {};
    clock_gettime(CLOCK_REALTIME, &now);
    if (result != nullptr) {
        *result = now.tv_sec;
    }
    return now.tv_sec;
}
