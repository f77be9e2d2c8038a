#include <fcntl.h>
#include <gtest/gtest-spi.h>
#include <syslog.h>
#include <unistd.h>

#include <filesystem>

#include "support/files.h"
#include "support/node.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/system_log.h"

using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;

namespace test {
namespace {

class SupportTest : public SandboxTest {};

TEST_F(SupportTest, ReadsTheDaemonLog) {
    EXPECT_THAT(daemonLogMessages(), IsEmpty());
    writeFile("/tmp/ha/ha.daemon.log",
              "2026-11-15T09:23:41+01:00 other.cpp:88 Failed to get meminfo\n"
              "2026-11-15T09:23:42-03:30 another.cpp:7 done\n");
    EXPECT_THAT(daemonLogMessages(),
                ElementsAre(LogLine("other.cpp", "Failed to get meminfo"), LogLine("another.cpp", "done")));
    EXPECT_THAT(daemonLogMessages().front(), Not(LogLine("other.cpp", "Failed to get memory")));
    EXPECT_THAT(daemonLogMessages().front(), Not(LogLine("othe.cpp", "Failed to get meminfo")));
    EXPECT_THAT("other.cpp:8x Failed", Not(LogLine("other.cpp", "Failed")));
    EXPECT_THAT("other.cpp: Failed", Not(LogLine("other.cpp", "Failed")));
}

TEST_F(SupportTest, DetectsALogLineWithoutATimeStamp) {
    EXPECT_NONFATAL_FAILURE(messages("2026-11-15 09:23:41 checker.cpp:88 text\n"), "no time stamp");
    EXPECT_NONFATAL_FAILURE(messages("2026-11-15T09:23:41+0100 checker.cpp:88 text\n"), "no time stamp");
}

TEST_F(SupportTest, ReadsTheEntriesOfTheRecord) {
    writeFile("/tmp/ha/ha.daemon.record",
              "2026-11-15T09:23:41+00:00 \nPID CMD\n1 init\n\n2026-11-15T09:23:42+00:00 \nx\n");
    EXPECT_THAT(recordEntries(), ElementsAre("\nPID CMD\n1 init\n", "\nx"));
}

// A nested test, whose failure can be inspected.
class LeakingTest : public SandboxTest {
 public:
    static void leak() {
        LeakingTest test;
        test.SetUp();
        descriptor = open("/dev/null", O_RDONLY | O_CLOEXEC);
        test.TearDown();
    }
    static int descriptor;

 private:
    void TestBody() override {}
};

int LeakingTest::descriptor = -1;

TEST_F(SupportTest, DetectsALeakedDescriptor) {
    EXPECT_NONFATAL_FAILURE(LeakingTest::leak(), "was left open: /dev/null");
    close(LeakingTest::descriptor);
}

TEST_F(SupportTest, CollectsTheSystemLog) {
    SystemLog log;
    EXPECT_THAT(log.entries(), IsEmpty());
    openlog("name", 0, LOG_DAEMON);
    // More than the queue of a socket holds.
    constexpr std::size_t COUNT = 200;
    for (std::size_t i = 0; i < COUNT; ++i) {
        syslog(LOG_ERR, "%s:%d text %zu", "other.cpp", 12, i);
    }
    const std::vector<SystemLog::Entry> entries = log.entries();
    ASSERT_EQ(entries.size(), COUNT);
    EXPECT_EQ(entries.back().priority, LOG_DAEMON | LOG_ERR);
    EXPECT_EQ(entries.back().ident, "name");
    EXPECT_THAT(log.texts().back(), LogLine("other.cpp", "text 199"));
}

class NodeTest : public SandboxTest {};

TEST_F(NodeTest, HasItsOwnNameProcessesFilesAndPrograms) {
    Node a("alpha");
    Node b("beta");
    const Process other({"sleep", "1234"});
    EXPECT_EQ(a.run({"hostname"}).output, "alpha\n");
    EXPECT_EQ(lines(a.run({"ip", "-oneline", "link"}).output).size(), 1U);
    EXPECT_THAT(a.run({"ps", "-eo", "args"}).output,
                AllOf(HasSubstr("ps -eo args"), Not(HasSubstr("sleep 1234"))));
    for (const char* path : {"/tmp/ha/node", "/var/log/node", "/run/node", "/proc/node", "/sys/block/node"}) {
        writeFile(a.path(path), "alpha");
        EXPECT_EQ(a.run({"cat", path}).output, "alpha") << path;
        EXPECT_FALSE(exists(b.path(path))) << path;
        EXPECT_FALSE(exists(path)) << path;
    }
    EXPECT_EQ(a.call([] {
        replaceProgram("/bin/ping", "echo replaced");
        return 0;
    }),
              0);
    EXPECT_EQ(a.run({"/bin/ping"}).output, "replaced\n");
    EXPECT_EQ(b.run({"/bin/ping", "-c", "1", "127.0.0.1"}).exitCode, 0);
    const std::string program = std::filesystem::read_symlink("/proc/self/exe");
    EXPECT_EQ(a.run({program, "--gtest_filter=None.*"}).exitCode, 0) << "the trees of the sandbox are there";
    EXPECT_THROW(a.run({"/no/such/program"}), std::system_error);
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

TEST_F(NodeTest, FailedExpectationInsideFailsTheTest) {
    Node node("alpha");
    std::fflush(stdout);
    EXPECT_EQ(node.call([] {
        // The failure is intended: keep it out of the output of this test.
        close(STDOUT_FILENO);
        EXPECT_TRUE(false);
        return 0;
    }),
              1);
    EXPECT_FALSE(HasFailure());
}

TEST_F(NodeTest, KillsAllItsProcesses) {
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

}  // namespace
}  // namespace test
