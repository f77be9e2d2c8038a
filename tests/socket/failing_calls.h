#pragma once

namespace test {

// While the object lives, listen and setsockopt fail with this error number in the whole process.
class FailingSocketCalls {
 public:
    explicit FailingSocketCalls(int error);
    ~FailingSocketCalls();

    FailingSocketCalls(const FailingSocketCalls&) = delete;
    FailingSocketCalls& operator=(const FailingSocketCalls&) = delete;
};

}  // namespace test
