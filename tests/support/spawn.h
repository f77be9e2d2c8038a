#pragma once

#include <sys/types.h>

#include <functional>

namespace test {

struct Spawned {
    pid_t child = -1;    ///< the process to wait for; it ends as `process` does
    pid_t process = -1;  ///< the process to send signals to
};

/// Runs `body` in a new process. It ends that process itself, or returns the errno with which a program could
/// not be started; `started` is for a body that starts no program, and tells that it is under way. With
/// `node` (a process descriptor of a node's first process) the new process belongs to that node. Throws
/// std::system_error when the process or the program cannot be started.
Spawned spawn(const std::function<int(const std::function<void()>& started)>& body, int node = -1);

}  // namespace test
