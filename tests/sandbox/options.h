#pragma once

#include <optional>
#include <string>
#include <vector>

namespace sandbox {

/// A directory of the machine that keeps its path inside.
struct Bind {
    std::string directory;
    bool writable = false;
};

struct Options {
    std::vector<Bind> binds;
    std::vector<std::string> environment;  ///< "NAME=VALUE"
    std::vector<std::string> program;      ///< empty for a node
    std::string hostname = "sandbox";
    bool randomizedAddresses = true;
    bool isNode = false;  ///< hold an empty sandbox open instead of running a program
};

/// Reads the command line. Nothing when the caller only asked for help or used it wrongly; `exitCode` is then
/// what to exit with, and the text has been printed.
std::optional<Options> parseOptions(int argc, char** argv, int& exitCode);

/// The environment for the program: a fixed clean one, what sanitizers, GoogleTest and gcov are told by the
/// caller, and the additions of the command line.
std::vector<std::string> cleanEnvironment(const Options& options);

}  // namespace sandbox
