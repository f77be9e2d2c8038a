#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

#include "support/descriptor.h"
#include "support/programs.h"

namespace test {

/// A node inside the sandbox: namespaces with their own root (built like that of the sandbox),
/// network (loopback only), hostname and processes. The destructor kills all its processes; destroy
/// its Process objects first. Failures throw std::system_error.
class Node {
 public:
    /// Create the node with the hostname `name`.
    explicit Node(const std::string& name);
    Node(const Node&) = delete;
    Node& operator=(const Node&) = delete;
    ~Node();

    /// Return the pid of the node's init as seen by the test.
    pid_t pid() const { return _pid; }

    /// Return the path of a file of the node as seen by the test. The path must not contain
    /// absolute symbolic links, which would resolve in the root of the test.
    std::string path(const std::string& inside) const;

    /// Run a program in the node and wait for it.
    CommandResult run(const std::vector<std::string>& argv) { return resultOf(start(argv)); }

    /// Start a program in the node.
    Process start(const std::vector<std::string>& argv) { return Process(argv, _process.get()); }

    /// Start a function in a forked process inside the node. Its result is the exit code; an
    /// exception or a failed expectation turns 0 into 1.
    Process start(const std::function<int()>& function) { return {function, _process.get()}; }

    /// Run a function like start() and return the exit code, or 128 + the number of the fatal
    /// signal.
    int call(const std::function<int()>& function) { return resultOf(start(function)).exitCode; }

 private:
    Process _holder;
    pid_t _pid = -1;
    Descriptor _process;
};

/// Connect two nodes by a veth pair, named eth1 in both, with the given IPv4 addresses in a /24
/// network.
void connect(Node& a, const std::string& addressA, Node& b, const std::string& addressB);

/// Set the node's end of the link up or down.
void setLink(Node& node, bool up);

}  // namespace test
