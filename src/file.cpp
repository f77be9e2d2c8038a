#include "file.h"

#include <unistd.h>

#include <cerrno>
#include <cstdio>

namespace TERN::HA::Daemon {

File::File(const char* path, int flags, mode_t mode)
    : _fd(static_cast<int>(TEMP_FAILURE_RETRY(open(path, flags | O_CLOEXEC, mode)))) {}

File::~File() {
    if (isOpen()) {
        close(_fd);
    }
}

ssize_t File::read(char* buffer, std::size_t size) const {
    return TEMP_FAILURE_RETRY(::read(_fd, buffer, size));
}

bool File::write(const char* data, std::size_t size) const {
    while (size > 0) {
        const ssize_t count = TEMP_FAILURE_RETRY(::write(_fd, data, size));
        if (count == -1) {
            return false;
        }
        data += count;
        size -= static_cast<std::size_t>(count);
    }
    return true;
}

bool readFile(const char* path, std::string& content) {
    const File file(path, O_RDONLY);
    if (!file.isOpen()) {
        return false;
    }
    char buffer[BUFSIZ];
    while (true) {
        const ssize_t count = file.read(buffer, sizeof buffer);
        if (count <= 0) {
            return true;
        }
        content.append(buffer, static_cast<std::size_t>(count));
    }
}

}  // namespace TERN::HA::Daemon
