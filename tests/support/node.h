#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

#include "support/descriptor.h"
#include "support/programs.h"

namespace test {

/// A machine of its own inside the sandbox: own root made as the sandbox's is (empty /tmp, /var and /run, the
/// fixtures of /proc and /sys, the machine's programs), own network with only a loopback interface, own host
/// name and processes. Everything in it ends with its object; a Process of it goes before. Failures throw
/// std::system_error.
class Node {
 public:
    /// Makes the node; `name` is its host name.
    explicit Node(const std::string& name);
    Node(const Node&) = delete;
    Node& operator=(const Node&) = delete;
    ~Node();

    /// The node's first process, as the test sees it.
    pid_t pid() const { return _pid; }

    /// The path by which the test reaches a file of the node. Absolute symbolic links in the node lead to the
    /// test's own files; use paths without any.
    std::string path(const std::string& inside) const;

    /// Runs a program in the node to its end.
    CommandResult run(const std::vector<std::string>& argv) { return resultOf(start(argv)); }

    /// Starts a program in the node.
    Process start(const std::vector<std::string>& argv) { return Process(argv, _process.get()); }

    /// Starts a function in a copy of this process inside the node: it has copies of the test's memory and
    /// descriptors, and its output is the test's. Its result is the exit code of the process; an exception or
    /// a failed expectation turns 0 into 1.
    Process start(const std::function<int()>& function) { return {function, _process.get()}; }

    /// Runs a function as start() does, and returns the exit code (128 + the signal that ended it).
    int call(const std::function<int()>& function) { return resultOf(start(function)).exitCode; }

 private:
    Process _holder;
    pid_t _pid = -1;
    Descriptor _process;
};

/// Joins two nodes by a network link. Its end is called eth1 in either of them and has the given IPv4 address
/// in a network of 24 bits.
void connect(Node& a, const std::string& addressA, Node& b, const std::string& addressB);

/// Takes the node's end of the link down or up.
void setLink(Node& node, bool up);

}  // namespace test
