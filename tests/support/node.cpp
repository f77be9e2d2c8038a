#include "support/node.h"

#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <chrono>

#include "support/sandbox_check.h"
#include "support/wait.h"

using namespace std::chrono_literals;

namespace test {
namespace {

constexpr const char* LINK = "eth1";

// The sandbox says "ready PID" when the node is complete.
pid_t awaitReady(Process& holder) {
    eventually(30s, [&] { return holder.output().find('\n') != std::string::npos || holder.waitFor(0ms); });
    const std::string output = holder.output();
    const std::string word = "ready ";
    check(output.compare(0, word.size(), word) == 0, "cannot make a node: " + holder.error(), ECHILD);
    return std::stoi(output.substr(word.size()));
}

void require(const CommandResult& result) {
    check(result.exitCode == 0, "ip failed: " + result.error, ECHILD);
}

}  // namespace

Node::Node(const std::string& name)
    : _holder({SANDBOX, "--node", name}),
      _pid(awaitReady(_holder)),
      _process(static_cast<int>(syscall(SYS_pidfd_open, _pid, 0)), "cannot open the node's process") {}

Node::~Node() {
    _holder.signal(SIGTERM);
    _holder.waitFor(10s);
}

std::string Node::path(const std::string& inside) const {
    return "/.kernel/proc/" + std::to_string(_pid) + "/root" + inside;
}

void connect(Node& a, const std::string& addressA, Node& b, const std::string& addressB) {
    require(run({"ip", "link", "add", LINK, "netns", std::to_string(a.pid()), "type", "veth", "peer", "name",
                 LINK, "netns", std::to_string(b.pid())}));
    require(a.run({"ip", "address", "add", addressA + "/24", "dev", LINK}));
    require(b.run({"ip", "address", "add", addressB + "/24", "dev", LINK}));
    setLink(a, true);
    setLink(b, true);
}

void setLink(Node& node, bool up) {
    require(node.run({"ip", "link", "set", LINK, up ? "up" : "down"}));
}

}  // namespace test
