#include "file.h"

#include <unistd.h>

#include <cerrno>

namespace TERN::HA::Daemon {

File::File(const char* path, int flags, mode_t mode) : _fd(-1) {
    do {
        _fd = open(path, flags | O_CLOEXEC, mode);
    } while (_fd < 0 && errno == EINTR);
}

File::~File() {
    if (_fd >= 0) {
        close(_fd);
    }
}

ssize_t File::read(char* buffer, std::size_t size) const {
    ssize_t count = 0;
    do {
        count = ::read(_fd, buffer, size);
    } while (count < 0 && errno == EINTR);
    return count;
}

bool File::write(const char* data, std::size_t size) const {
    while (size > 0) {
        const ssize_t count = ::write(_fd, data, size);
        if (count >= 0) {
            data += count;
            size -= static_cast<std::size_t>(count);
        } else if (errno != EINTR) {
            return false;
        }
    }
    return true;
}

bool readFile(const char* path, std::string& content) {
    const File file(path, O_RDONLY);
    if (!file.isOpen()) {
        return false;
    }
    content.clear();
    char buffer[4096];
    ssize_t count = 0;
    while ((count = file.read(buffer, sizeof buffer)) > 0) {
        content.append(buffer, static_cast<std::size_t>(count));
    }
    return true;
}

}  // namespace TERN::HA::Daemon
