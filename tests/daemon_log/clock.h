#pragma once

#include <ctime>

namespace test {

// Makes the library believe that it is `now`, for as long as the object lives.
class FixedTime {
 public:
    explicit FixedTime(std::time_t now);
    ~FixedTime();

    FixedTime(const FixedTime&) = delete;
    FixedTime& operator=(const FixedTime&) = delete;
};

}  // namespace test
