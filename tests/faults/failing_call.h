#pragma once

#include <map>
#include <string>

namespace test {

// Calls of the C library that tests of this executable can watch and let fail. They are put in front of the C
// library's own, for every library of the process; the library under test is as it is installed.

// Counts the calls of this thread while it lives.
class CallCounter {
 public:
    CallCounter();
    ~CallCounter();

    CallCounter(const CallCounter&) = delete;
    CallCounter& operator=(const CallCounter&) = delete;

    // How often each function was called so far.
    std::map<std::string, int> counts() const;
};

// While it lives, the `number`th call of the function by this thread, counted from 1, fails with `error`.
class FailingCall {
 public:
    FailingCall(const std::string& function, int number, int error);
    ~FailingCall();

    FailingCall(const FailingCall&) = delete;
    FailingCall& operator=(const FailingCall&) = delete;

    // Whether that call has come.
    bool hasFailed() const;
};

}  // namespace test
