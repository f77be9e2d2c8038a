#include "env_check/failing_calls.h"

#include <sys/socket.h>
#include <sys/time.h>

#include <atomic>
#include <cerrno>

#include "support/real_function.h"

namespace {

std::atomic<int> socketError{0};
std::atomic<int> optionError{0};
std::atomic<std::chrono::seconds> timeout{std::chrono::seconds(-1)};

std::atomic<int>& errorOf(test::SystemCall call) {
    return call == test::SystemCall::Socket ? socketError : optionError;
}

bool isIpv4(int descriptor) {
    int domain = 0;
    socklen_t size = sizeof domain;
    return getsockopt(descriptor, SOL_SOCKET, SO_DOMAIN, &domain, &size) == 0 && domain == AF_INET;
}

int failWith(int error) {
    errno = error;
    return -1;
}

}  // namespace

// The dynamic linker takes a function of the executable before that of the C library, for every library of
// the process.

int socket(int domain, int type, int protocol) noexcept {
    static auto* const realSocket = test::realFunction<int(int, int, int)>("socket");
    if (socketError != 0 && domain == AF_INET) {
        return failWith(socketError);
    }
    return realSocket(domain, type, protocol);
}

int setsockopt(int descriptor, int level, int name, const void* value, socklen_t size) noexcept {
    static auto* const realSetsockopt =
        test::realFunction<int(int, int, int, const void*, socklen_t)>("setsockopt", "__setsockopt64");
    if (optionError != 0 && isIpv4(descriptor)) {
        return failWith(optionError);
    }
    if (isIpv4(descriptor) && level == SOL_SOCKET && name == SO_RCVTIMEO) {
        timeout = std::chrono::seconds(static_cast<const timeval*>(value)->tv_sec);
    }
    return realSetsockopt(descriptor, level, name, value, size);
}

namespace test {

std::chrono::seconds receiveTimeout() {
    return timeout;
}

FailingCall::FailingCall(SystemCall call, int error) : call_(call) {
    errorOf(call_) = error;
}

FailingCall::~FailingCall() {
    errorOf(call_) = 0;
}

}  // namespace test
