#include <dlfcn.h>
#include <pthread.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <fstream>
#include <string>

// Preloaded into a daemon: while a file of this name exists, the call fails or does not return.

namespace {

bool exists(const char* path) {
    return access(path, F_OK) == 0;
}

}  // namespace

extern "C" ssize_t sendto(int fd, const void* data, size_t size, int flags, const sockaddr* address,
                          socklen_t length) {
    if (exists("/tmp/no-buffers")) {
        errno = ENOBUFS;
        return -1;
    }
    using Function = ssize_t (*)(int, const void*, size_t, int, const sockaddr*, socklen_t);
    static const auto next = reinterpret_cast<Function>(dlsym(RTLD_NEXT, "sendto"));
    return next(fd, data, size, flags, address, length);
}

extern "C" int accept4(int fd, sockaddr* address, socklen_t* length, int flags) {
    if (exists("/tmp/no-connections")) {
        errno = ENOMEM;
        return -1;
    }
    using Function = int (*)(int, sockaddr*, socklen_t*, int);
    static const auto next = reinterpret_cast<Function>(dlsym(RTLD_NEXT, "accept4"));
    return next(fd, address, length, flags);
}

extern "C" int pthread_create(pthread_t* thread, const pthread_attr_t* attributes, void* (*start)(void*),
                              void* argument) noexcept {
    if (exists("/tmp/no-threads")) {
        return EAGAIN;
    }
    using Function = int (*)(pthread_t*, const pthread_attr_t*, void* (*)(void*), void*);
    static const auto next = reinterpret_cast<Function>(dlsym(RTLD_NEXT, "pthread_create"));
    return next(thread, attributes, start, argument);
}

// A look at what has come, without taking it, sees its first byte only: the rest comes right after.
extern "C" ssize_t recv(int fd, void* data, size_t size, int flags) {
    using Function = ssize_t (*)(int, void*, size_t, int);
    static const auto next = reinterpret_cast<Function>(dlsym(RTLD_NEXT, "recv"));
    return next(fd, data, (flags & MSG_PEEK) != 0 && exists("/tmp/slow-client") ? 1 : size, flags);
}

extern "C" int clock_gettime(clockid_t clock, timespec* time) noexcept {
    using Function = int (*)(clockid_t, timespec*);
    static const auto next = reinterpret_cast<Function>(dlsym(RTLD_NEXT, "clock_gettime"));
    const int result = next(clock, time);
    if ((clock == CLOCK_REALTIME && exists("/tmp/stepped-clock")) ||
        (clock == CLOCK_MONOTONIC && exists("/tmp/an-hour-later"))) {
        time->tv_sec += 3600;
    }
    return result;
}

// A frozen file system lets nothing be made, not even what is there already. /run is in memory.
extern "C" int mkdir(const char* path, mode_t mode) noexcept {
    while (std::strncmp(path, "/run/", 5) != 0 && exists("/tmp/frozen-disks")) {
        usleep(10000);
    }
    using Function = int (*)(const char*, mode_t);
    static const auto next = reinterpret_cast<Function>(dlsym(RTLD_NEXT, "mkdir"));
    return next(path, mode);
}

// Names the flushed directory in a file.
extern "C" int syncfs(int fd) noexcept {
    char path[64] = {};
    const ssize_t size = readlink(("/proc/self/fd/" + std::to_string(fd)).c_str(), path, sizeof(path));
    std::ofstream("/tmp/flushed") << std::string(path, static_cast<std::size_t>(size));
    return 0;
}

extern "C" void sync() noexcept {
    while (exists("/tmp/hanging-sync")) {
        usleep(10000);
    }
}
