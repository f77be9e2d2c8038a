#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <utility>

namespace ternhad {

// A listening local socket and its file. For one thread.
class Listener {
 public:
    // `directoryMode`: of the socket's directory, should it vanish.
    Listener(std::string path, mode_t directoryMode)
        : _path(std::move(path)), _directoryMode(directoryMode) {}
    ~Listener() { close(); }

    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

    // Makes the socket file, in place of one that a former daemon has left, and its directory if that is
    // missing but the one above is not, and listens. False, with errno,
    // when that fails; EEXIST when something else than a socket has the name.
    bool listen();

    // Gives the socket file, which listen() makes, to a group: it may connect. Call first.
    void shareWith(gid_t group) { _group = group; }

    // False once somebody has removed or replaced the socket file.
    bool hasFile() const;

    // True once it has listened.
    bool hasHadFile() const { return _inode != 0; }

    // Removes the socket file if it is still this listener's.
    void removeFile() const;

    int fd() const { return _fd; }  // -1 when it does not listen
    const std::string& path() const { return _path; }

 private:
    void makeDirectory() const;
    void close();

    std::string _path;
    mode_t _directoryMode;
    std::optional<gid_t> _group;
    int _fd = -1;
    dev_t _device = 0;  // of the socket file
    ino_t _inode = 0;
};

}  // namespace ternhad
