#include "instance.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <string>

namespace ternhad {

namespace {

constexpr char DIRECTORY[] = "/run/ternha";
constexpr char PATH[] = "/run/ternha/ternhad.lock";

}  // namespace

InstanceLock::~InstanceLock() {
    handOver();
}

void InstanceLock::handOver() {
    if (_fd >= 0) {
        close(_fd);
        _fd = -1;
    }
}

InstanceLock::Result InstanceLock::take() {
    if (mkdir(DIRECTORY, S_IRWXU) != 0 && errno != EEXIST) {
        return Result::failed;
    }
    _fd = open(PATH, O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, S_IRUSR | S_IWUSR);
    if (_fd < 0) {
        return Result::failed;
    }
    if (flock(_fd, LOCK_EX | LOCK_NB) != 0) {
        if (errno != EWOULDBLOCK) {
            return Result::failed;
        }
        std::array<char, 16> text = {};
        if (read(_fd, text.data(), text.size() - 1) > 0) {
            _owner = static_cast<pid_t>(std::strtol(text.data(), nullptr, 10));
        }
        return Result::isRunning;
    }
    const std::string text = std::to_string(getpid()) + "\n";
    const bool isWritten =
        ftruncate(_fd, 0) == 0 && write(_fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
    return isWritten ? Result::taken : Result::failed;
}

}  // namespace ternhad
