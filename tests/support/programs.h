#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "support/descriptor.h"
#include "support/spawn.h"

/// Programs of the sandbox: real ones to run, and stand-ins put in their place. Failures throw
/// std::system_error; outside the sandbox every operation ends the process.
namespace test {

/// Puts an executable script in the place of an existing program, for the rest of the test or until
/// restoreProgram(). A script that does not begin with "#!" is one for /bin/sh. Nodes made afterwards have it
/// too.
void replaceProgram(const std::string& path, const std::string& script);

/// Makes an existing program impossible to start (EACCES), for the rest of the test or until
/// restoreProgram().
void hideProgram(const std::string& path);

/// Takes the latest stand-in or cover off an existing program.
void restoreProgram(const std::string& path);

/// Writes an executable script to a path where there is no program of the machine; missing directories are
/// made. A script that does not begin with "#!" is one for /bin/sh.
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
    /// output and error are collected.
    explicit Process(const std::vector<std::string>& argv);
    Process(Process&& other) noexcept;
    Process& operator=(Process&& other) noexcept;
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;
    ~Process();

    pid_t pid() const { return spawned_.process; }

    /// Sends a signal; nothing happens when the process has ended.
    void signal(int number);

    /// The wait status as waitpid() gives it, or nothing when the process still runs after `deadline`.
    std::optional<int> waitFor(std::chrono::milliseconds deadline);

    /// Waits for the end without a limit and returns the wait status.
    int wait();

    /// What it has written to its standard output (error) up to now.
    std::string output() const;
    std::string error() const;

 private:
    friend class Node;
    Process(const std::vector<std::string>& argv, int node);
    Process(const std::function<int()>& function, int node);
    bool reap(int flags);

    Descriptor output_;
    Descriptor error_;
    Spawned spawned_;
    std::optional<int> status_;
};

/// Runs a program to its end.
CommandResult run(const std::vector<std::string>& argv);

/// Waits for the end of a process and collects what it said.
CommandResult resultOf(Process process);

}  // namespace test
