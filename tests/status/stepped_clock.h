#pragma once

namespace test {

// The wall clock is set forward by an hour right after the process has looked at it for the next time.
void stepClockAfterNextLook();

}  // namespace test
