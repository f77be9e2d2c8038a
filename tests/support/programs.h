#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "support/descriptor.h"

/// Programs and stubs in the sandbox. Failures throw std::system_error.
namespace test {

/// Covers an existing program by a script until the test ends or restoreProgram(). A script that
/// does not begin with "#!" is one for /bin/sh. Nodes made afterwards have it too.
void replaceProgram(const std::string& path, const std::string& script);

/// Make starting an existing program fail with EACCES until the test ends or restoreProgram().
void hideProgram(const std::string& path);

/// Undo the latest replacement of a program.
void restoreProgram(const std::string& path);

/// Create an executable script at an unused path.
void createProgram(const std::string& path, const std::string& script);

struct CommandResult {
    int status = -1;    ///< as waitpid() gives it
    int exitCode = -1;  ///< 128 + the number of the signal that ended it
    std::string output;
    std::string error;
};

/// A child process; the destructor kills and reaps it.
class Process {
 public:
    /// Start argv[0], looked up in PATH if it has no slash, with standard input from /dev/null.
    /// Standard output and error are collected. `node` is a process descriptor of a node's first
    /// process, or -1.
    explicit Process(const std::vector<std::string>& argv, int node = -1);

    /// Run a function in a forked process inside a node. Its result is the exit code; an exception
    /// or a failed expectation turns 0 into 1.
    Process(const std::function<int()>& function, int node);

    Process(Process&& other) noexcept { *this = std::move(other); }
    Process& operator=(Process&& other) noexcept;
    ~Process();

    pid_t pid() const { return _pid; }

    /// Send a signal, unless the process has ended.
    void signal(int number) const;

    /// Return the wait status, or nothing if the process still runs after `deadline`.
    std::optional<int> waitFor(std::chrono::milliseconds deadline);

    /// Wait without a deadline and return the wait status.
    int wait();

    /// Return its standard output (error) so far.
    std::string output() const;
    std::string error() const;

 private:
    bool reap(int flags);

    Descriptor _output;
    Descriptor _error;
    pid_t _pid = -1;
    std::optional<int> _status;
};

/// Run a program and wait for it.
CommandResult run(const std::vector<std::string>& argv);

/// Wait for a process and collect its output.
CommandResult resultOf(Process process);

}  // namespace test
