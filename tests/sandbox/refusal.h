#pragma once

#include <cerrno>
#include <string>
#include <system_error>

namespace sandbox {

/// Part of the private world could not be made. The launcher then runs nothing at all: the program must
/// never meet the machine itself.
class Refusal : public std::system_error {
 public:
    explicit Refusal(const std::string& what, int error = errno)
        : std::system_error(error, std::generic_category(), what) {}
};

/// Throws a Refusal with the current errno unless `done`.
inline void require(bool done, const std::string& what) {
    if (!done) {
        throw Refusal(what);
    }
}

}  // namespace sandbox
