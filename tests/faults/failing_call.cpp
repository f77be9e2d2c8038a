#include "faults/failing_call.h"

#include <fcntl.h>
#include <glob.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>

#include "support/real_function.h"

namespace {

thread_local std::map<std::string, int>* counted = nullptr;
thread_local const char* failing = nullptr;
thread_local int countdown = 0;
thread_local int failure = 0;

// Counts the call, and tells whether it is the one to fail; errno is set then.
bool fails(const char* function) {
    if (counted != nullptr) {
        std::map<std::string, int>* const counts = counted;
        counted = nullptr;  // what the map needs is not the library's
        ++(*counts)[function];
        counted = counts;
    }
    if (failing == nullptr || std::string(failing) != function || --countdown != 0) {
        return false;
    }
    errno = failure;
    return true;
}

}  // namespace

// Opened for the library with a mode only where it is made.
int open64(const char* path, int flags, ...) {
    static auto* const real = test::realFunction<int(const char*, int, ...)>("open64");
    va_list arguments;
    va_start(arguments, flags);
    const unsigned int mode = (flags & O_CREAT) != 0 ? va_arg(arguments, unsigned int) : 0;
    va_end(arguments);
    return fails("open") ? -1 : real(path, flags, mode);
}

ssize_t read(int fd, void* buffer, std::size_t size) {
    static auto* const real = test::realFunction<ssize_t(int, void*, std::size_t)>("read");
    return fails("read") ? -1 : real(fd, buffer, size);
}

ssize_t write(int fd, const void* data, std::size_t size) {
    static auto* const real = test::realFunction<ssize_t(int, const void*, std::size_t)>("write");
    return fails("write") ? -1 : real(fd, data, size);
}

int close(int fd) {
    static auto* const real = test::realFunction<int(int)>("close");
    const int result = real(fd);  // closed all the same, as by the kernel
    return fails("close") ? -1 : result;
}

int socket(int domain, int type, int protocol) noexcept {
    static auto* const real = test::realFunction<int(int, int, int)>("socket");
    return fails("socket") ? -1 : real(domain, type, protocol);
}

int bind(int fd, const sockaddr* address, socklen_t length) noexcept {
    static auto* const real = test::realFunction<int(int, const sockaddr*, socklen_t)>("bind");
    return fails("bind") ? -1 : real(fd, address, length);
}

int listen(int fd, int backlog) noexcept {
    static auto* const real = test::realFunction<int(int, int)>("listen");
    return fails("listen") ? -1 : real(fd, backlog);
}

int connect(int fd, const sockaddr* address, socklen_t length) {
    static auto* const real = test::realFunction<int(int, const sockaddr*, socklen_t)>("connect");
    return fails("connect") ? -1 : real(fd, address, length);
}

int accept4(int fd, sockaddr* address, socklen_t* length, int flags) {
    static auto* const real = test::realFunction<int(int, sockaddr*, socklen_t*, int)>("accept4");
    return fails("accept") ? -1 : real(fd, address, length, flags);
}

int setsockopt(int fd, int level, int name, const void* value, socklen_t length) noexcept {
    static auto* const real =
        test::realFunction<int(int, int, int, const void*, socklen_t)>("setsockopt", "__setsockopt64");
    return fails("setsockopt") ? -1 : real(fd, level, name, value, length);
}

ssize_t send(int fd, const void* data, std::size_t size, int flags) {
    static auto* const real = test::realFunction<ssize_t(int, const void*, std::size_t, int)>("send");
    return fails("send") ? -1 : real(fd, data, size, flags);
}

ssize_t recv(int fd, void* buffer, std::size_t size, int flags) {
    static auto* const real = test::realFunction<ssize_t(int, void*, std::size_t, int)>("recv");
    return fails("recv") ? -1 : real(fd, buffer, size, flags);
}

ssize_t sendto(int fd, const void* data, std::size_t size, int flags, const sockaddr* address,
               socklen_t length) {
    static auto* const real =
        test::realFunction<ssize_t(int, const void*, std::size_t, int, const sockaddr*, socklen_t)>("sendto");
    return fails("sendto") ? -1 : real(fd, data, size, flags, address, length);
}

ssize_t recvfrom(int fd, void* buffer, std::size_t size, int flags, sockaddr* address, socklen_t* length) {
    static auto* const real =
        test::realFunction<ssize_t(int, void*, std::size_t, int, sockaddr*, socklen_t*)>("recvfrom");
    return fails("recvfrom") ? -1 : real(fd, buffer, size, flags, address, length);
}

int unlink(const char* path) noexcept {
    static auto* const real = test::realFunction<int(const char*)>("unlink");
    return fails("unlink") ? -1 : real(path);
}

int rename(const char* from, const char* to) noexcept {
    static auto* const real = test::realFunction<int(const char*, const char*)>("rename");
    return fails("rename") ? -1 : real(from, to);
}

int access(const char* path, int mode) noexcept {
    static auto* const real = test::realFunction<int(const char*, int)>("access");
    return fails("access") ? -1 : real(path, mode);
}

int stat(const char* path, struct stat* info) noexcept {
    static auto* const real = test::realFunction<int(const char*, struct stat*)>("stat64", "__stat64_time64");
    return fails("stat") ? -1 : real(path, info);
}

int glob64(const char* pattern, int flags, int (*onError)(const char*, int), glob64_t* matches) {
    static auto* const real = test::realFunction<int(const char*, int, int (*)(const char*, int), glob64_t*)>(
        "glob64", "__glob64_time64");
    return fails("glob") ? GLOB_NOSPACE : real(pattern, flags, onError, matches);
}

int posix_spawn(pid_t* child, const char* path, const posix_spawn_file_actions_t* actions,
                const posix_spawnattr_t* attributes, char* const argv[], char* const envp[]) {
    static auto* const real =
        test::realFunction<int(pid_t*, const char*, const posix_spawn_file_actions_t*,
                               const posix_spawnattr_t*, char* const[], char* const[])>("posix_spawn");
    return fails("posix_spawn") ? failure : real(child, path, actions, attributes, argv, envp);
}

pid_t waitpid(pid_t child, int* status, int options) {
    static auto* const real = test::realFunction<pid_t(pid_t, int*, int)>("waitpid");
    const pid_t result = real(child, status, options);  // the end is waited for, as with SIGCHLD ignored
    return fails("waitpid") ? -1 : result;
}

int pipe2(int* ends, int flags) noexcept {
    static auto* const real = test::realFunction<int(int*, int)>("pipe2");
    return fails("pipe") ? -1 : real(ends, flags);
}

FILE* fdopen(int fd, const char* mode) noexcept {
    static auto* const real = test::realFunction<FILE*(int, const char*)>("fdopen");
    return fails("fdopen") ? nullptr : real(fd, mode);
}

namespace test {

CallCounter::CallCounter() {
    counted = new std::map<std::string, int>;
}

CallCounter::~CallCounter() {
    delete counted;
    counted = nullptr;
}

std::map<std::string, int> CallCounter::counts() const {
    return *counted;
}

FailingCall::FailingCall(const std::string& function, int number, int error) {
    static thread_local std::string name;
    name = function;
    countdown = number;
    failure = error;
    failing = name.c_str();
}

FailingCall::~FailingCall() {
    failing = nullptr;
}

bool FailingCall::hasFailed() const {
    return countdown <= 0;
}

}  // namespace test
