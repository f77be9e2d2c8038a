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
    Descriptor(int descriptor, const std::string& what) : descriptor_(descriptor) {
        if (descriptor == -1) {
            throw std::system_error(errno, std::generic_category(), what);
        }
    }
    Descriptor(Descriptor&& other) noexcept : descriptor_(std::exchange(other.descriptor_, -1)) {}
    Descriptor& operator=(Descriptor&& other) noexcept {
        std::swap(descriptor_, other.descriptor_);
        return *this;
    }
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;
    ~Descriptor() { reset(); }

    int get() const { return descriptor_; }

    void reset() {
        if (descriptor_ != -1) {
            close(descriptor_);
            descriptor_ = -1;
        }
    }

 private:
    int descriptor_ = -1;
};

}  // namespace test
