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

    // Call read(2), again when a signal interrupts it. Returns the bytes read, 0 at the end,
    // -1 on failure.
    ssize_t read(char* buffer, std::size_t size) const;

    // Write `data`: one write(2), more only after a partial write. Data after a failure is lost.
    void write(const char* data, std::size_t size) const;

    // Whether it is a regular file; whether root or this process's user owns it.
    bool isRegular() const;
    bool isTrusted() const;

 private:
    int _fd;
};

// Appends the bytes of the file at `path`, best effort, to `content`. False when it cannot be
// opened.
bool readFile(const char* path, std::string& content);

enum class Owner { any, trusted };

// Return the content of a small file: does not block, and reads at most `limit` bytes. Empty if it
// cannot be opened or is not a regular file. Owner::trusted, for directories that other users can
// write to: also empty for a symbolic link and for a file owned by another user than root and that
// of this process.
std::string readSmallFile(const char* path, std::size_t limit, Owner owner);

}  // namespace TERN::HA::Daemon
