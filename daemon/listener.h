#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <utility>

namespace ternhad {

// A listening Unix socket and its file. Not thread-safe.
class Listener {
 public:
    // directoryMode: mode of the socket's directory if it must be recreated.
    Listener(std::string path, mode_t directoryMode)
        : _path(std::move(path)), _directoryMode(directoryMode) {}
    ~Listener() { close(); }

    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

    // Create the socket file, replacing that of an earlier daemon, and its directory if only that
    // is missing, and listen. Returns false with errno on failure; EEXIST if the path is not a
    // socket.
    bool listen();

    // Allow `group` to connect to the socket. To be called before listen().
    void shareWith(gid_t group) { _group = group; }

    // False if the socket file was removed or replaced.
    bool hasFile() const;

    // True once listen() has succeeded.
    bool hasHadFile() const { return _inode != 0; }

    // Remove the socket file if it is still this listener's.
    void removeFile() const;

    int fd() const { return _fd; }  // -1 while not listening
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
