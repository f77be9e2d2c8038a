#include "file.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
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

void File::write(const char* data, std::size_t size) const {
    while (size > 0) {
        const ssize_t count = TEMP_FAILURE_RETRY(::write(_fd, data, size));
        if (count == -1) {
            return;
        }
        data += count;
        size -= static_cast<std::size_t>(count);
    }
}

bool File::isRegular() const {
    struct stat info = {};
    return fstat(_fd, &info) == 0 && S_ISREG(info.st_mode);
}

bool File::isTrusted() const {
    struct stat info = {};
    return fstat(_fd, &info) == 0 && (info.st_uid == 0 || info.st_uid == geteuid());
}

namespace {

void readAll(const File& file, std::size_t limit, std::string& content) {
    char buffer[BUFSIZ];
    while (content.size() < limit) {
        const ssize_t count = file.read(buffer, std::min(sizeof buffer, limit - content.size()));
        if (count <= 0) {
            return;
        }
        content.append(buffer, static_cast<std::size_t>(count));
    }
}

}  // namespace

bool readFile(const char* path, std::string& content) {
    const File file(path, O_RDONLY);
    if (!file.isOpen()) {
        return false;
    }
    readAll(file, std::string::npos, content);
    return true;
}

std::string readSmallFile(const char* path, std::size_t limit, Owner owner) {
    const bool mustBeTrusted = owner == Owner::trusted;
    const File file(path, O_RDONLY | O_NONBLOCK | (mustBeTrusted ? O_NOFOLLOW : 0));
    std::string content;
    if (file.isOpen() && file.isRegular() && (file.isTrusted() || !mustBeTrusted)) {
        readAll(file, limit, content);
    }
    return content;
}

}  // namespace TERN::HA::Daemon
