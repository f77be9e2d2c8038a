#include "socket/failing_calls.h"

#include <sys/socket.h>
#include <sys/time.h>

#include <atomic>
#include <cerrno>
#include <utility>

#include "support/real_function.h"

namespace {

std::atomic<int> failure{0};
std::atomic<int> lastBacklog{-1};
std::atomic<std::chrono::seconds> lastTimeout{std::chrono::seconds(-1)};
std::function<void()> afterConnect;

int failWith(int error) {
    errno = error;
    return -1;
}

}  // namespace

// The dynamic linker takes these before those of the C library, for every library of the process.

int socket(int domain, int type, int protocol) noexcept {
    static auto* const realSocket = test::realFunction<int(int, int, int)>("socket");
    const bool isLocalStream = domain == AF_UNIX && (type & ~SOCK_CLOEXEC) == SOCK_STREAM;
    return failure != 0 && isLocalStream ? failWith(failure) : realSocket(domain, type, protocol);
}

int connect(int fd, const sockaddr* address, socklen_t size) {
    static auto* const realConnect = test::realFunction<int(int, const sockaddr*, socklen_t)>("connect");
    const int result = realConnect(fd, address, size);
    const int error = errno;
    if (afterConnect) {
        afterConnect();
    }
    errno = error;
    return result;
}

int listen(int fd, int backlog) noexcept {
    static auto* const realListen = test::realFunction<int(int, int)>("listen");
    lastBacklog = backlog;
    return failure != 0 ? failWith(failure) : realListen(fd, backlog);
}

int setsockopt(int fd, int level, int name, const void* value, socklen_t size) noexcept {
    static auto* const realSetsockopt =
        test::realFunction<int(int, int, int, const void*, socklen_t)>("setsockopt", "__setsockopt64");
    if (level == SOL_SOCKET && name == SO_RCVTIMEO) {
        lastTimeout = std::chrono::seconds(static_cast<const timeval*>(value)->tv_sec);
    }
    return failure != 0 ? failWith(failure) : realSetsockopt(fd, level, name, value, size);
}

namespace test {

int backlog() {
    return lastBacklog;
}

std::chrono::seconds receiveTimeout() {
    return lastTimeout;
}

FailingSocketCalls::FailingSocketCalls(int error) {
    failure = error;
}

FailingSocketCalls::~FailingSocketCalls() {
    failure = 0;
}

ConnectHook::ConnectHook(std::function<void()> onConnect) {
    afterConnect = std::move(onConnect);
}

ConnectHook::~ConnectHook() {
    afterConnect = nullptr;
}

}  // namespace test
