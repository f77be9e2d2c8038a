#include "support/node.h"

#include <signal.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <filesystem>

#include "support/files.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "support/udp.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::Not;

namespace test {
namespace {

class NodeTest : public SandboxTest {};

TEST_F(NodeTest, HasItsOwnNameAndProcesses) {
    Node node("alpha");
    const Process other({"sleep", "1234"});
    EXPECT_EQ(node.run({"hostname"}).output, "alpha\n");
    EXPECT_THAT(node.run({"ps", "-eo", "args"}).output,
                AllOf(HasSubstr("ps -eo args"), Not(HasSubstr("sleep 1234"))));
}

TEST_F(NodeTest, HasItsOwnFiles) {
    Node a("alpha");
    Node b("beta");
    for (const char* path :
         {"/tmp/ha/file", "/var/log/file", "/run/file", "/proc/drbd", "/sys/block/md0/file"}) {
        writeFile(a.path(path), "alpha");
        EXPECT_EQ(a.run({"cat", path}).output, "alpha") << path;
        EXPECT_FALSE(exists(b.path(path))) << path;
        EXPECT_FALSE(exists(path)) << path;
    }
    EXPECT_EQ(b.run({"sh", "-c", "echo beta > /tmp/file"}).exitCode, 0);
    EXPECT_EQ(readFile(b.path("/tmp/file")), "beta\n");
}

TEST_F(NodeTest, KeepsTheTreesOfTheSandbox) {
    Node node("alpha");
    const std::string program = std::filesystem::read_symlink("/proc/self/exe");
    EXPECT_EQ(node.run({program, "--gtest_filter=None.*"}).exitCode, 0);
}

TEST_F(NodeTest, HasItsOwnNetwork) {
    Node a("alpha");
    Node b("beta");
    UdpSocket own("127.0.0.1", 7499);
    const auto receive = [] {
        UdpSocket socket("127.0.0.1", 7499);
        UdpSocket().send("own", "127.0.0.1", 7499);
        const auto datagram = socket.receive(10s);
        return datagram && datagram->bytes == "own" ? 0 : 1;
    };
    EXPECT_EQ(a.call(receive), 0);
    EXPECT_EQ(b.call(receive), 0);
    EXPECT_FALSE(own.receive(20ms));
}

TEST_F(NodeTest, CallsFunctionsInside) {
    Node node("alpha");
    EXPECT_EQ(node.call([] { return 7; }), 7);
    EXPECT_EQ(node.call([] {
        char name[16] = {};
        gethostname(name, sizeof name - 1);
        return std::string(name) == "alpha" ? 0 : 1;
    }),
              0);
    EXPECT_EQ(node.call([]() -> int { throw std::runtime_error("expected"); }), 1);
    EXPECT_EQ(node.call([] { return raise(SIGKILL); }), 128 + SIGKILL);
}

TEST_F(NodeTest, AFailedExpectationInsideIsAFailure) {
    Node node("alpha");
    std::fflush(stdout);
    EXPECT_EQ(node.call([] {
        // The failure is meant to happen: its report does not belong into the output of this test.
        close(STDOUT_FILENO);
        EXPECT_TRUE(false);
        return 0;
    }),
              1);
    EXPECT_FALSE(HasFailure());
}

TEST_F(NodeTest, ReplacesProgramsForItselfOnly) {
    Node node("alpha");
    ASSERT_EQ(node.call([] {
        replaceProgram("/bin/ping", "echo replaced");
        return 0;
    }),
              0);
    EXPECT_EQ(node.run({"/bin/ping"}).output, "replaced\n");
    EXPECT_EQ(run({"/bin/ping", "-c", "1", "127.0.0.1"}).exitCode, 0);
}

TEST_F(NodeTest, StartsAndStopsProcesses) {
    Node node("alpha");
    Process process = node.start({"sleep", "1234"});
    EXPECT_THAT(node.run({"ps", "-eo", "args"}).output, HasSubstr("sleep 1234"));
    EXPECT_EQ(process.waitFor(20ms), std::nullopt);

    process.signal(SIGSTOP);
    EXPECT_TRUE(eventually(10s, [&] {
        return readFile("/proc/" + std::to_string(process.pid()) + "/stat").find(" T ") != std::string::npos;
    }));
    process.signal(SIGKILL);
    EXPECT_EQ(process.waitFor(30s), SIGKILL);
}

TEST_F(NodeTest, ReportsAProgramThatCannotBeStarted) {
    Node node("alpha");
    EXPECT_THROW(node.run({"/no/such/program"}), std::system_error);
}

TEST_F(NodeTest, EndsWithAllItsProcesses) {
    pid_t first = -1;
    {
        Node node("alpha");
        first = node.pid();
        EXPECT_EQ(node.run({"sh", "-c", "setsid sleep 1234 &"}).exitCode, 0);
        EXPECT_THAT(run({"ps", "-eo", "args"}).output, HasSubstr("sleep 1234"));
    }
    EXPECT_EQ(kill(first, 0), -1);
    EXPECT_THAT(run({"ps", "-eo", "args"}).output, Not(HasSubstr("sleep 1234")));
}

TEST_F(NodeTest, HasItsOwnSystemLog) {
    Node node("alpha");
    SystemLog log(node.path("/dev/log"));
    EXPECT_EQ(node.call([] {
        openlog("inside", 0, LOG_USER);
        syslog(LOG_ERR, "hello");
        return 0;
    }),
              0);
    ASSERT_TRUE(log.waitFor(1));
    EXPECT_EQ(log.entries().front().ident, "inside");
    EXPECT_EQ(log.entries().front().text, "hello");
    EXPECT_FALSE(exists("/dev/log"));
}

// Whether within `deadline` a datagram from `a` arrives at `b` and its answer comes back.
bool datagramsPass(Node& a, Node& b, std::chrono::milliseconds deadline) {
    Process answering = b.start([] {
        UdpSocket socket("10.0.0.2", 7499);
        while (const auto request = socket.receive(60s)) {
            socket.send(request->bytes, request->address, request->port);
        }
        return 1;
    });
    return a.call([deadline] {
        UdpSocket socket("10.0.0.1");
        const bool answered = eventually(deadline, [&] {
            try {
                socket.send("question", "10.0.0.2", 7499);
            } catch (const std::system_error&) {
                return false;
            }
            const auto answer = socket.receive(100ms);
            return answer && answer->bytes == "question";
        });
        return answered ? 0 : 1;
    }) == 0;
}

TEST_F(NodeTest, LinkCanBeCutAndJoinedAgain) {
    Node a("alpha");
    Node b("beta");
    connect(a, "10.0.0.1", b, "10.0.0.2");
    EXPECT_TRUE(datagramsPass(a, b, 30s));
    setLink(b, false);
    EXPECT_FALSE(datagramsPass(a, b, 500ms));
    setLink(b, true);
    EXPECT_TRUE(datagramsPass(a, b, 30s));
    setLink(a, false);
    EXPECT_FALSE(datagramsPass(a, b, 500ms));
    setLink(a, true);
    EXPECT_TRUE(datagramsPass(a, b, 30s));
    EXPECT_THAT(a.run({"/sbin/ifconfig", "-s"}).output, HasSubstr("\neth1 "));
    EXPECT_EQ(b.run({"/bin/ping", "-c", "1", "10.0.0.1"}).exitCode, 0);
}

}  // namespace
}  // namespace test
