#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "support/descriptor.h"

/// Programs of the sandbox: real ones to run, and stubs in their place. Failures throw std::system_error.
namespace test {

/// Covers an existing program by a script until the test ends or restoreProgram(). A script that does not
/// begin with "#!" is one for /bin/sh. Nodes made afterwards have it too.
void replaceProgram(const std::string& path, const std::string& script);

/// Makes an existing program impossible to start (EACCES) until the test ends or restoreProgram().
void hideProgram(const std::string& path);

/// Takes the latest cover off an existing program.
void restoreProgram(const std::string& path);

/// Writes an executable script to a path where there is no program of the machine.
void createProgram(const std::string& path, const std::string& script);

struct CommandResult {
    int status = -1;    ///< as waitpid() gives it
    int exitCode = -1;  ///< 128 + the number of the signal that ended it
    std::string output;
    std::string error;
};

/// A process that runs beside the test. It is killed and reaped with its object.
class Process {
 public:
    /// Starts argv[0], looked up in PATH when it has no slash, with standard input from /dev/null. Standard
    /// output and error are collected. `node` is a process descriptor of a node's first process, or -1.
    explicit Process(const std::vector<std::string>& argv, int node = -1);

    /// Calls a function in a copy of this process inside a node. Its result is the exit code; an exception or
    /// a failed expectation turns 0 into 1.
    Process(const std::function<int()>& function, int node);

    Process(Process&& other) noexcept { *this = std::move(other); }
    Process& operator=(Process&& other) noexcept;
    ~Process();

    pid_t pid() const { return _pid; }

    /// Sends a signal; nothing happens when the process has ended.
    void signal(int number) const;

    /// The wait status as waitpid() gives it, or nothing when the process still runs after `deadline`.
    std::optional<int> waitFor(std::chrono::milliseconds deadline);

    /// Waits for the end without a limit and returns the wait status.
    int wait();

    /// What it has written to its standard output (error) up to now.
    std::string output() const;
    std::string error() const;

 private:
    bool reap(int flags);

    Descriptor _output;
    Descriptor _error;
    pid_t _pid = -1;
    std::optional<int> _status;
};

/// Runs a program to its end.
CommandResult run(const std::vector<std::string>& argv);

/// Waits for the end of a process and collects what it said.
CommandResult resultOf(Process process);

}  // namespace test
