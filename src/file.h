#pragma once

#include <fcntl.h>
#include <sys/types.h>

#include <cstddef>
#include <string>

namespace TERN::HA::Daemon {

// An open file, closed with its scope.
class File {
 public:
    // Opened close-on-exec; `flags` and `mode` as for open(2).
    File(const char* path, int flags, mode_t mode = 0666);
    ~File();

    File(const File&) = delete;
    File& operator=(const File&) = delete;

    bool isOpen() const { return _fd >= 0; }

    // One read(2), begun again when a signal interrupts it. Returns the bytes read, 0 at the end, -1 on
    // failure.
    ssize_t read(char* buffer, std::size_t size) const;

    // Writes `data`: one write(2), more only where the kernel took part of it. What it does not take is lost.
    void write(const char* data, std::size_t size) const;

    // A regular file; of root or of this process's user.
    bool isRegular() const;
    bool isTrusted() const;

 private:
    int _fd;
};

// Appends the bytes of the file at `path`, best effort, to `content`. False when it cannot be opened.
bool readFile(const char* path, std::string& content);

enum class Owner { any, trusted };

// The content of a small file, where something else may stand in its place: opens without waiting, and takes
// at most `limit` bytes. Empty for what cannot be opened or is no regular file. Owner::trusted, where other
// users can write to the directory: empty, too, for a symbolic link and for what belongs neither to root nor
// to this process's user.
std::string readSmallFile(const char* path, std::size_t limit, Owner owner);

}  // namespace TERN::HA::Daemon
