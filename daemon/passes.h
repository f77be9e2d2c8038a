#pragma once

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <exception>

namespace ternhad {

// Run a step of the daemon. Returns false if it fails for lack of memory or another resource.
template <typename Step>
bool attempt(const Step& step) noexcept {
    try {
        step();
        return true;
    } catch (const std::exception& error) {
        (void)std::fprintf(stderr, "ternhad: a step failed: %s\n", error.what());
        return false;
    }
}

// Passes of one thread. A failed pass loses only its own results. When all fail for 10 seconds, the
// state that the thread maintains is stale: abort rather than report it.
class Passes {
 public:
    template <typename Pass>
    void run(const Pass& pass) noexcept {
        if (attempt(pass)) {
            _areFailing = false;
        } else if (!_areFailing) {
            _areFailing = true;
            _failingSince = Clock::now();
        } else if (Clock::now() - _failingSince >= FAILURE_LIMIT) {
            std::abort();
        }
    }

 private:
    using Clock = std::chrono::steady_clock;

    static constexpr auto FAILURE_LIMIT = std::chrono::seconds(10);

    bool _areFailing = false;
    Clock::time_point _failingSince;
};

}  // namespace ternhad
