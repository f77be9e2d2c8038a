#include "support/node.h"

#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <stdexcept>

#include "support/sandbox_check.h"
#include "support/wait.h"

namespace test {
namespace {

constexpr std::chrono::seconds kReady{30};
constexpr std::chrono::seconds kEnd{10};
constexpr const char* kLink = "eth1";

// The launcher says "ready PID" when the node is complete.
pid_t awaitReady(Process& holder) {
    const std::string word = "ready ";
    eventually(kReady, [&] {
        return holder.output().find('\n') != std::string::npos ||
               holder.waitFor(std::chrono::milliseconds(0));
    });
    const std::string output = holder.output();
    if (output.compare(0, word.size(), word) != 0) {
        throw std::runtime_error("cannot make a node: " + holder.error());
    }
    return std::stoi(output.substr(word.size()));
}

void require(const CommandResult& result) {
    if (result.exitCode != 0) {
        throw std::runtime_error("ip failed: " + result.error);
    }
}

}  // namespace

Node::Node(const std::string& name)
    : holder_({TERNHA_SANDBOX_PROGRAM, "--node", name}),
      pid_(awaitReady(holder_)),
      process_(static_cast<int>(syscall(SYS_pidfd_open, pid_, 0)), "cannot open the node's process") {}

Node::~Node() {
    holder_.signal(SIGTERM);
    holder_.waitFor(kEnd);
}

std::string Node::path(const std::string& inside) const {
    return "/.kernel/proc/" + std::to_string(pid_) + "/root" + inside;
}

CommandResult Node::run(const std::vector<std::string>& argv) {
    return resultOf(start(argv));
}

Process Node::start(const std::vector<std::string>& argv) {
    return {argv, process_.get()};
}

Process Node::start(const std::function<int()>& function) {
    return {function, process_.get()};
}

int Node::call(const std::function<int()>& function) {
    return resultOf(start(function)).exitCode;
}

void connect(Node& a, const std::string& addressA, Node& b, const std::string& addressB) {
    require(run({"ip", "link", "add", kLink, "netns", std::to_string(a.pid()), "type", "veth", "peer", "name",
                 kLink, "netns", std::to_string(b.pid())}));
    require(a.run({"ip", "address", "add", addressA + "/24", "dev", kLink}));
    require(b.run({"ip", "address", "add", addressB + "/24", "dev", kLink}));
    setLink(a, true);
    setLink(b, true);
}

void setLink(Node& node, bool up) {
    require(node.run({"ip", "link", "set", kLink, up ? "up" : "down"}));
}

}  // namespace test
