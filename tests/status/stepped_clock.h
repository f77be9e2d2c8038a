#pragma once

#include <chrono>

namespace test {

// The wall clock is set forward by `step`, back when that is negative, right after the process has looked at
// it for the next time.
void stepClockAfterNextLook(std::chrono::seconds step);

}  // namespace test
