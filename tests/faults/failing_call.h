#pragma once

#include <chrono>
#include <functional>
#include <map>
#include <string>

/// Fault injection: functions of the C library that tests can count and make fail. They are
/// interposed for every library of the process; the library under test is the installed one.
namespace test {

/// Counts the calls of this thread for the lifetime of the object.
class CallCounter {
 public:
    CallCounter();
    ~CallCounter();

    CallCounter(const CallCounter&) = delete;
    CallCounter& operator=(const CallCounter&) = delete;

    /// Return the number of calls of each function so far.
    std::map<std::string, int> counts() const;
};

/// Makes calls of a function fail for the lifetime of the object. Only one object may exist at a
/// time.
class FailingCall {
 public:
    /// Every call fails with the errno `error`, in every thread.
    FailingCall(const char* function, int error);

    /// The `number`th call of this thread, counted from 1, fails with the errno `error`.
    FailingCall(const std::string& function, int number, int error);

    ~FailingCall();

    FailingCall(const FailingCall&) = delete;
    FailingCall& operator=(const FailingCall&) = delete;

    /// Return whether the `number`th call has happened.
    bool hasFailed() const;
};

/// Return the last arguments of this process: backlog of listen() and receive timeout; -1 when
/// unset.
int backlog();
std::chrono::seconds receiveTimeout();

/// Calls `onConnect` after each successful connect(), before it returns, for the lifetime of the
/// object.
class ConnectHook {
 public:
    explicit ConnectHook(std::function<void()> onConnect);
    ~ConnectHook();

    ConnectHook(const ConnectHook&) = delete;
    ConnectHook& operator=(const ConnectHook&) = delete;
};

}  // namespace test
