#pragma once

namespace test {

// While the object lives, listen, setsockopt and the making of local stream sockets fail with this error
// number in the whole process. (Taking all descriptors away instead would confuse the sanitizers.)
class FailingSocketCalls {
 public:
    explicit FailingSocketCalls(int error);
    ~FailingSocketCalls();

    FailingSocketCalls(const FailingSocketCalls&) = delete;
    FailingSocketCalls& operator=(const FailingSocketCalls&) = delete;
};

}  // namespace test
