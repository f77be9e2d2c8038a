#pragma once

#include <string>

#include "support/programs.h"

namespace test {

// What ternhactl prints on standard output and error, and its exit code.
inline CommandResult control(const std::string& arguments) {
    return run({"/bin/sh", "-c", "exec 2>&1; " TERNHACTL " " + arguments});
}

}  // namespace test
