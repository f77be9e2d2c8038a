#pragma once

#include <unistd.h>

#include <cerrno>
#include <string>
#include <system_error>
#include <utility>

namespace test {

/// Throw std::system_error with an error number, by default errno, unless `done`.
inline void check(bool done, const std::string& what, int error = errno) {
    if (!done) {
        throw std::system_error(error, std::generic_category(), what);
    }
}

/// Owns a file descriptor.
class Descriptor {
 public:
    Descriptor() = default;

    /// Take over the result of a system call; throw std::system_error with errno when it is -1.
    Descriptor(int descriptor, const std::string& what) : _descriptor(descriptor) {
        check(descriptor != -1, what);
    }
    Descriptor(Descriptor&& other) noexcept : _descriptor(std::exchange(other._descriptor, -1)) {}
    Descriptor& operator=(Descriptor&& other) noexcept {
        std::swap(_descriptor, other._descriptor);
        return *this;
    }
    ~Descriptor() { reset(); }

    int get() const { return _descriptor; }

    void reset() {
        if (_descriptor != -1) {
            close(std::exchange(_descriptor, -1));
        }
    }

 private:
    int _descriptor = -1;
};

}  // namespace test
