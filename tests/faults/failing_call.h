#pragma once

#include <chrono>
#include <functional>
#include <map>
#include <string>

/// Calls of the C library that a test can watch and let fail. They are put in front of the C library's own,
/// for every library of the process; the library under test is as it is installed.
namespace test {

/// Counts the calls of this thread while it lives.
class CallCounter {
 public:
    CallCounter();
    ~CallCounter();

    CallCounter(const CallCounter&) = delete;
    CallCounter& operator=(const CallCounter&) = delete;

    /// How often each function was called so far.
    std::map<std::string, int> counts() const;
};

/// Lets calls of a function fail while it lives. One at a time.
class FailingCall {
 public:
    /// Every call fails with `error`, in every thread.
    FailingCall(const char* function, int error);

    /// The `number`th call by this thread, counted from 1, fails with `error`.
    FailingCall(const std::string& function, int number, int error);

    ~FailingCall();

    FailingCall(const FailingCall&) = delete;
    FailingCall& operator=(const FailingCall&) = delete;

    /// Whether the `number`th call has come.
    bool hasFailed() const;
};

/// What a socket of this process was given last: the length of its queue (-1 when none was), and the time-out
/// for receiving (-1 s).
int backlog();
std::chrono::seconds receiveTimeout();

/// While the object lives, `onConnect` is called after each connection of a socket, before connect returns.
class ConnectHook {
 public:
    explicit ConnectHook(std::function<void()> onConnect);
    ~ConnectHook();

    ConnectHook(const ConnectHook&) = delete;
    ConnectHook& operator=(const ConnectHook&) = delete;
};

}  // namespace test
