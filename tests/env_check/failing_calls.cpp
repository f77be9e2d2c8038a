#include "env_check/failing_calls.h"

#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>

namespace {

std::atomic<int> socketError{0};
std::atomic<int> optionError{0};

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
    if (socketError != 0 && domain == AF_INET) {
        return failWith(socketError);
    }
    return static_cast<int>(syscall(SYS_socket, domain, type, protocol));
}

int setsockopt(int descriptor, int level, int name, const void* value, socklen_t size) noexcept {
    if (optionError != 0 && isIpv4(descriptor)) {
        return failWith(optionError);
    }
    return static_cast<int>(syscall(SYS_setsockopt, descriptor, level, name, value, size));
}

namespace test {

FailingCall::FailingCall(SystemCall call, int error) : call_(call) {
    errorOf(call_) = error;
}

FailingCall::~FailingCall() {
    errorOf(call_) = 0;
}

}  // namespace test
