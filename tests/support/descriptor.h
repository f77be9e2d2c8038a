#pragma once

#include <unistd.h>

#include <cerrno>
#include <string>
#include <system_error>
#include <utility>

namespace test {

/// Owns a file descriptor.
class Descriptor {
 public:
    Descriptor() = default;

    /// Takes over the result of a system call; throws std::system_error with the current errno when it is -1.
    Descriptor(int descriptor, const std::string& what) : _descriptor(descriptor) {
        if (descriptor == -1) {
            throw std::system_error(errno, std::generic_category(), what);
        }
    }
    Descriptor(Descriptor&& other) noexcept : _descriptor(std::exchange(other._descriptor, -1)) {}
    Descriptor& operator=(Descriptor&& other) noexcept {
        std::swap(_descriptor, other._descriptor);
        return *this;
    }
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;
    ~Descriptor() { reset(); }

    int get() const { return _descriptor; }

    void reset() {
        if (_descriptor != -1) {
            close(_descriptor);
            _descriptor = -1;
        }
    }

 private:
    int _descriptor = -1;
};

}  // namespace test
