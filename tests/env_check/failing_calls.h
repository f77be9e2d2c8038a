#pragma once

#include <chrono>

namespace test {

/// System calls of this process that a test can make fail.
enum class SystemCall { Socket, SetSocketOption };

/// While the object lives, `call` fails with `error` on IPv4 sockets; sockets of other families (the system
/// log's) work on.
class FailingCall {
 public:
    FailingCall(SystemCall call, int error);
    ~FailingCall();

    FailingCall(const FailingCall&) = delete;
    FailingCall& operator=(const FailingCall&) = delete;

 private:
    SystemCall call_;
};

/// The receive time-out that an IPv4 socket of this process was given last; -1 s when none was.
std::chrono::seconds receiveTimeout();

}  // namespace test
