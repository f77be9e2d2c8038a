#pragma once

#include <filesystem>
#include <string>
#include <vector>

#include "support/programs.h"

namespace test {

/// The command that runs a shell script in a sandbox inside this one, which then stands for the machine.
inline std::vector<std::string> sandboxCommand(const std::string& script,
                                               const std::vector<std::string>& options = {}) {
    std::vector<std::string> command{TERNHA_SANDBOX_PROGRAM};
    command.insert(command.end(), options.begin(), options.end());
    command.insert(command.end(), {"--", "/bin/sh", "-c", script});
    return command;
}

inline CommandResult runInSandbox(const std::string& script, const std::vector<std::string>& options = {}) {
    return run(sandboxCommand(script, options));
}

/// The path of this test executable.
inline std::string ownProgram() {
    return std::filesystem::read_symlink("/proc/self/exe");
}

}  // namespace test
