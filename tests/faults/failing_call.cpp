#include "faults/failing_call.h"

#include <fcntl.h>
#include <glob.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <utility>

#include "faults/real_function.h"

namespace {

std::atomic<const char*> failingAlways{nullptr};
std::atomic<int> failureAlways{0};
std::atomic<int> lastBacklog{-1};
std::atomic<std::chrono::seconds> lastTimeout{std::chrono::seconds(-1)};
std::function<void()> afterConnect;

thread_local std::map<std::string, int>* counted = nullptr;
thread_local std::string failing;
thread_local int countdown = 0;
thread_local int failure = 0;

// Count the call and return whether it must fail; if so, errno is set.
bool fails(const char* function) {
    if (counted != nullptr) {
        std::map<std::string, int>* const counts = std::exchange(counted, nullptr);
        ++(*counts)[function];  // what the map needs is not the library's
        counted = counts;
    }
    const char* const always = failingAlways;
    if (always != nullptr && std::strcmp(always, function) == 0) {
        errno = failureAlways;
        return true;
    }
    if (failing != function || --countdown != 0) {
        return false;
    }
    errno = failure;
    return true;
}

}  // namespace

// Defines an interposed function: it fails if `fails(KEY)`, and calls the real function otherwise.
#define INTERPOSE(RESULT, NAME, KEY, FAILURE, PARAMETERS, ARGUMENTS, SPECIFIER) \
    RESULT NAME PARAMETERS SPECIFIER {                                          \
        static auto* const real = test::realFunction<RESULT PARAMETERS>(#NAME); \
        return fails(KEY) ? (FAILURE) : real ARGUMENTS;                         \
    }

// clang-format off
INTERPOSE(ssize_t, read, "read", -1, (int fd, void* data, size_t size), (fd, data, size), )
INTERPOSE(ssize_t, write, "write", -1, (int fd, const void* data, size_t size), (fd, data, size), )
INTERPOSE(int, socket, "socket", -1, (int domain, int type, int protocol), (domain, type, protocol), noexcept)
INTERPOSE(int, bind, "bind", -1, (int fd, const sockaddr* address, socklen_t size), (fd, address, size), noexcept)
INTERPOSE(int, accept4, "accept", -1, (int fd, sockaddr* address, socklen_t* size, int flags),
          (fd, address, size, flags), )
INTERPOSE(ssize_t, send, "send", -1, (int fd, const void* data, size_t size, int flags), (fd, data, size, flags), )
INTERPOSE(ssize_t, recv, "recv", -1, (int fd, void* data, size_t size, int flags), (fd, data, size, flags), )
INTERPOSE(ssize_t, sendto, "sendto", -1,
          (int fd, const void* data, size_t size, int flags, const sockaddr* address, socklen_t length),
          (fd, data, size, flags, address, length), )
INTERPOSE(ssize_t, recvfrom, "recvfrom", -1,
          (int fd, void* data, size_t size, int flags, sockaddr* address, socklen_t* length),
          (fd, data, size, flags, address, length), )
INTERPOSE(int, unlink, "unlink", -1, (const char* path), (path), noexcept)
INTERPOSE(int, rename, "rename", -1, (const char* from, const char* to), (from, to), noexcept)
INTERPOSE(int, access, "access", -1, (const char* path, int mode), (path, mode), noexcept)
INTERPOSE(int, posix_spawn, "posix_spawn", errno,
          (pid_t* child, const char* path, const posix_spawn_file_actions_t* actions,
           const posix_spawnattr_t* attributes, char* const* argv, char* const* envp),
          (child, path, actions, attributes, argv, envp), )
INTERPOSE(int, pipe2, "pipe", -1, (int* ends, int flags), (ends, flags), noexcept)
INTERPOSE(FILE*, fdopen, "fdopen", nullptr, (int fd, const char* mode), (fd, mode), noexcept)
// clang-format on

// The names with 64-bit time on 32-bit machines.

int setsockopt(int fd, int level, int name, const void* value, socklen_t size) noexcept {
    static auto* const real =
        test::realFunction<int(int, int, int, const void*, socklen_t)>("setsockopt", "__setsockopt64");
    if (level == SOL_SOCKET && name == SO_RCVTIMEO) {
        lastTimeout = std::chrono::seconds(static_cast<const timeval*>(value)->tv_sec);
    }
    return fails("setsockopt") ? -1 : real(fd, level, name, value, size);
}

int glob64(const char* pattern, int flags, int (*onError)(const char*, int), glob64_t* matches) {
    static auto* const real = test::realFunction<int(const char*, int, int (*)(const char*, int), glob64_t*)>(
        "glob64", "__glob64_time64");
    return fails("glob") ? GLOB_NOSPACE : real(pattern, flags, onError, matches);
}

int stat(const char* path, struct stat* info) noexcept {
    static auto* const real = test::realFunction<int(const char*, struct stat*)>("stat64", "__stat64_time64");
    return fails("stat") ? -1 : real(path, info);
}

// The mode is passed only with O_CREAT.
int open64(const char* path, int flags, ...) {
    static auto* const real = test::realFunction<int(const char*, int, ...)>("open64");
    va_list arguments;
    va_start(arguments, flags);
    const unsigned int mode = (flags & O_CREAT) != 0 ? va_arg(arguments, unsigned int) : 0;
    va_end(arguments);
    return fails("open") ? -1 : real(path, flags, mode);
}

int close(int fd) {
    static auto* const real = test::realFunction<int(int)>("close");
    const int result = real(fd);  // closed all the same, as by the kernel
    return fails("close") ? -1 : result;
}

pid_t waitpid(pid_t child, int* status, int options) {
    static auto* const real = test::realFunction<pid_t(pid_t, int*, int)>("waitpid");
    const pid_t result = real(child, status, options);  // the end is waited for, as with SIGCHLD ignored
    return fails("waitpid") ? -1 : result;
}

int listen(int fd, int backlog) noexcept {
    static auto* const real = test::realFunction<int(int, int)>("listen");
    lastBacklog = backlog;
    return fails("listen") ? -1 : real(fd, backlog);
}

int connect(int fd, const sockaddr* address, socklen_t size) {
    static auto* const real = test::realFunction<int(int, const sockaddr*, socklen_t)>("connect");
    const int result = fails("connect") ? -1 : real(fd, address, size);
    if (afterConnect) {
        const int error = errno;
        afterConnect();
        errno = error;
    }
    return result;
}

namespace test {

CallCounter::CallCounter() {
    counted = new std::map<std::string, int>;
}

CallCounter::~CallCounter() {
    delete std::exchange(counted, nullptr);
}

std::map<std::string, int> CallCounter::counts() const {
    return *counted;
}

FailingCall::FailingCall(const char* function, int error) {
    failureAlways = error;
    failingAlways = function;
}

FailingCall::FailingCall(const std::string& function, int number, int error) {
    countdown = number;
    failure = error;
    failing = function;
}

FailingCall::~FailingCall() {
    failingAlways = nullptr;
    failing.clear();
}

bool FailingCall::hasFailed() const {
    return countdown <= 0;
}

int backlog() {
    return lastBacklog;
}

std::chrono::seconds receiveTimeout() {
    return lastTimeout;
}

ConnectHook::ConnectHook(std::function<void()> onConnect) {
    afterConnect = std::move(onConnect);
}

ConnectHook::~ConnectHook() {
    afterConnect = nullptr;
}

}  // namespace test
