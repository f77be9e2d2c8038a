#pragma once

#include <sys/types.h>

#include <chrono>
#include <string>
#include <vector>

namespace sandbox {

/// Blocks the signals that superviseChild() waits for. Call it before the child is started; the child gets
/// the former mask back with unblockSignals().
void blockSignals();
void unblockSignals();

/// Passes SIGTERM and SIGINT on to `child`, reaps every other child, and returns the wait status of `child`.
int superviseChild(pid_t child);

/// As pid 1: reaps children until SIGTERM or SIGINT.
void reapUntilTerminated();

/// The exit code that a shell would report for a wait status.
int exitCodeOf(int status);

/// As pid 1: waits until no other process is left in the pid namespace; returns those that are there after
/// `grace`, as "PID (COMMAND LINE)".
std::vector<std::string> leftProcesses(std::chrono::milliseconds grace);

}  // namespace sandbox
