#include "checker/fast_sleep.h"

#include <unistd.h>

#include <utility>

namespace {

std::function<void(int)> hook;
std::vector<unsigned int> asked;

}  // namespace

// The dynamic linker takes this one before that of the C library.
unsigned int sleep(unsigned int seconds) {
    asked.push_back(seconds);
    if (hook) {
        hook(static_cast<int>(asked.size()));
    }
    return 0;
}

namespace test {

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
