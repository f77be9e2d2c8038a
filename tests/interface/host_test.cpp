// The host daemon of docs/integrating.md.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include "control.h"
#include "support/files.h"
#include "support/node.h"
#include "support/sandbox.h"
#include "support/udp.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using ::testing::Contains;

constexpr char CONTROL[] = "/run/control.sock";
constexpr char BUFFER[] = "/tmp/ha/ha.daemon.log";
constexpr char LOG[] = "/var/log/ha/ha.daemon.log";

std::vector<std::string> command(const std::string& local, const std::string& remote) {
    return {EXAMPLE_HOST, local, remote, "eth1", CONTROL};
}

Json::Value statusAt(const std::string& socket) {
    Json::Value status;
    if (test::exists(socket)) {
        TERN::HA::Daemon::MonitordSocket(socket, 5).getServerData(status);
    }
    return status;
}

int exitCode(test::Process& process) {
    const auto status = process.waitFor(20s);
    return status && WIFEXITED(*status) ? WEXITSTATUS(*status) : -1;
}

struct Machine {
    Machine(const std::string& name, const std::string& local, const std::string& remote)
        : node(name), argv(command(local, remote)) {
        test::makeDirectories(node.path("/tmp/ha"));
        test::makeDirectories(node.path("/var/log/ha"));
        test::writeFile(node.path("/sys/block/md0/md/sync_action"), "idle\n");
    }

    bool sees(const char* flag) {
        const Json::Value status = statusAt(node.path(CONTROL));
        return status.isObject() && status[flag].asBool();
    }

    test::Node node;
    std::vector<std::string> argv;
};

TEST(ExampleHostTest, TwoHostsExchangeTheirState) {
    Machine a("node-a", "10.0.0.1", "10.0.0.2");
    Machine b("node-b", "10.0.0.2", "10.0.0.1");
    test::connect(a.node, "10.0.0.1", b.node, "10.0.0.2");
    const test::Process hostA = a.node.start(a.argv);
    test::Process hostB = b.node.start(b.argv);
    EXPECT_TRUE(test::eventually(20s, [&] { return a.sees("isRemoteAlive") && b.sees("isRemoteAlive"); }));

    test::writeFile(b.node.path("/sys/block/md0/md/sync_action"), "resync\n");
    EXPECT_TRUE(test::eventually(20s, [&] { return b.sees("isMDResync") && a.sees("isRemoteMDResync"); }));

    hostB.signal(SIGTERM);
    EXPECT_EQ(exitCode(hostB), 0);
    EXPECT_TRUE(test::eventually(20s, [&] { return !a.sees("isRemoteAlive"); }));
}

class OneExampleHostTest : public test::SandboxTest {};

TEST_F(OneExampleHostTest, FlushesItsLogAndExitsOnSigterm) {
    test::Process host(command("127.0.0.1", "127.0.0.2"));
    EXPECT_TRUE(test::eventually(20s, [] { return !statusAt(CONTROL).isNull(); })) << host.error();
    const test::Stopwatch stopwatch;
    host.signal(SIGTERM);
    EXPECT_EQ(exitCode(host), 0);
    EXPECT_LT(stopwatch.elapsed(), 2s);
    EXPECT_THAT(test::messages(test::readFile(LOG)), Contains(test::LogLine("host.cpp", "Stopping")));
    EXPECT_EQ(test::readFile(BUFFER), "");
}

TEST_F(OneExampleHostTest, ExitsWhenThePortIsInUse) {
    const test::UdpSocket taken("127.0.0.1", 7499);
    test::Process host(command("127.0.0.1", "127.0.0.2"));
    EXPECT_EQ(exitCode(host), 1);
    EXPECT_THAT(
        test::daemonLogMessages(),
        Contains(test::LogLine("env_check.cpp", "Failed to start socket serverAddress already in use")));
}

TEST_F(OneExampleHostTest, RejectsAWrongCommandLine) {
    test::Process host({EXAMPLE_HOST});
    EXPECT_EQ(exitCode(host), 2);
}

}  // namespace
