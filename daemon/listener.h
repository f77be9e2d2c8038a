#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <utility>

namespace ternhad {

// A listening local socket and its file. For one thread.
class Listener {
 public:
    explicit Listener(std::string path) : _path(std::move(path)) {}
    ~Listener() { close(); }

    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

    // Makes the socket file, in place of one that a former daemon has left, and listens. False, with errno,
    // when that fails; EEXIST when something else than a socket has the name.
    bool listen();

    // Gives the socket file, which listen() makes, to a group: it may connect. Call first.
    void shareWith(gid_t group) { _group = group; }

    // False once somebody has removed or replaced the socket file.
    bool hasFile() const;

    // Removes the socket file if it is still this listener's.
    void removeFile() const;

    int fd() const { return _fd; }  // -1 when it does not listen
    const std::string& path() const { return _path; }

 private:
    void close();

    std::string _path;
    std::optional<gid_t> _group;
    int _fd = -1;
    dev_t _device = 0;  // of the socket file
    ino_t _inode = 0;
};

}  // namespace ternhad
