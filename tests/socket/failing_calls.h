#pragma once

#include <chrono>
#include <functional>

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

// What local sockets of this process were given last.
int backlog();
std::chrono::seconds receiveTimeout();

// While the object lives, `onConnect` is called after each connection of a socket, before connect returns.
class ConnectHook {
 public:
    explicit ConnectHook(std::function<void()> onConnect);
    ~ConnectHook();

    ConnectHook(const ConnectHook&) = delete;
    ConnectHook& operator=(const ConnectHook&) = delete;
};

}  // namespace test
