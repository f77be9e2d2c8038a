#include "listener.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>

namespace ternhad {

namespace {

constexpr int BACKLOG = 100;
constexpr mode_t SHARED_MODE = 0660;

sockaddr_un addressOf(const std::string& path) {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    path.copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
    return address;
}

bool share(const std::string& path, gid_t group) {
    return chown(path.c_str(), static_cast<uid_t>(-1), group) == 0 && chmod(path.c_str(), SHARED_MODE) == 0;
}

}  // namespace

bool Listener::listen() {
    close();
    makeDirectory();
    struct stat info = {};
    if (lstat(_path.c_str(), &info) == 0) {
        if (!S_ISSOCK(info.st_mode)) {
            errno = EEXIST;
            return false;
        }
        unlink(_path.c_str());
    }
    _fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    const sockaddr_un address = addressOf(_path);
    if (_fd < 0 || bind(_fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(_fd, BACKLOG) != 0 || lstat(_path.c_str(), &info) != 0 ||
        (_group && !share(_path, *_group))) {
        const int error = errno;
        close();
        errno = error;
        return false;
    }
    _device = info.st_dev;
    _inode = info.st_ino;
    return true;
}

void Listener::makeDirectory() const {
    const std::string directory = std::filesystem::path(_path).parent_path();
    struct stat info = {};
    if (lstat(directory.c_str(), &info) != 0 && mkdir(directory.c_str(), _directoryMode) == 0) {
        chmod(directory.c_str(), _directoryMode);  // whatever the umask is
    }
}

bool Listener::hasFile() const {
    struct stat info = {};
    return lstat(_path.c_str(), &info) == 0 && info.st_dev == _device && info.st_ino == _inode;
}

void Listener::removeFile() const {
    if (hasFile()) {
        unlink(_path.c_str());
    }
}

void Listener::close() {
    if (_fd >= 0) {
        ::close(_fd);
        _fd = -1;
    }
}

}  // namespace ternhad
