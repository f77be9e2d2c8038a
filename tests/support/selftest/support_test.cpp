#include <fcntl.h>
#include <gtest/gtest-spi.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>

#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "support/udp.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Not;

namespace test {
namespace {

class SupportTest : public SandboxTest {};

TEST_F(SupportTest, WritesReadsAndRemovesFiles) {
    writeFile("/tmp/new/file", std::string("a\0b\n", 4));
    appendFile("/tmp/new/file", "c");
    EXPECT_EQ(readFile("/tmp/new/file"), std::string("a\0b\nc", 5));
    writeFile("/tmp/new/file", "");
    EXPECT_EQ(readFile("/tmp/new/file"), "");
    EXPECT_TRUE(exists("/tmp/new"));
    removeTree("/tmp/new");
    EXPECT_FALSE(exists("/tmp/new"));
    EXPECT_THROW(readFile("/tmp/new/file"), std::system_error);
    EXPECT_THAT(lines("one\n\ntwo"), ElementsAre("one", "", "two"));
}

TEST_F(SupportTest, MakesTheDirectoriesOfTheLog) {
    for (const char* directory : {"/tmp/ha", "/var/log/ha"}) {
        struct stat status = {};
        ASSERT_EQ(stat(directory, &status), 0) << directory;
        EXPECT_EQ(status.st_mode & 07777U, 0700U) << directory;
    }
}

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

TEST_F(SupportTest, NoticesALogLineWithoutATimeStamp) {
    EXPECT_NONFATAL_FAILURE(messages("2026-11-15 09:23:41 checker.cpp:88 text\n"), "no time stamp");
    EXPECT_NONFATAL_FAILURE(messages("2026-11-15T09:23:41+0100 checker.cpp:88 text\n"), "no time stamp");
}

TEST_F(SupportTest, ReadsTheEntriesOfTheRecord) {
    writeFile("/tmp/ha/ha.daemon.record",
              "2026-11-15T09:23:41+00:00 \nPID CMD\n1 init\n\n2026-11-15T09:23:42+00:00 \nx\n");
    EXPECT_THAT(recordEntries(), ElementsAre("\nPID CMD\n1 init\n", "\nx"));
}

// A test of its own inside a test, so that its failure can be looked at.
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

TEST_F(SupportTest, NoticesADescriptorLeftOpen) {
    EXPECT_NONFATAL_FAILURE(LeakingTest::leak(), "was left open: /dev/null");
    close(LeakingTest::descriptor);
}

TEST_F(SupportTest, PollsUntilAConditionHolds) {
    int asked = 0;
    EXPECT_TRUE(eventually(10s, [&] { return ++asked == 3; }));
    EXPECT_EQ(asked, 3);
    const Stopwatch stopwatch;
    EXPECT_FALSE(eventually(50ms, [] { return false; }));
    EXPECT_GE(stopwatch.elapsed(), 50ms);
}

TEST_F(SupportTest, ReplacesHidesAndRestoresPrograms) {
    replaceProgram("/bin/ping", "echo \"ping $*\"; exit 3");
    const CommandResult replaced = run({"/bin/ping", "-c", "1"});
    EXPECT_EQ(replaced.output, "ping -c 1\n");
    EXPECT_EQ(replaced.exitCode, 3);

    hideProgram("/bin/ping");
    EXPECT_THROW(run({"/bin/ping"}), std::system_error);

    restoreProgram("/bin/ping");
    EXPECT_EQ(run({"/bin/ping"}).output, "ping \n");
    restoreProgram("/bin/ping");
    EXPECT_EQ(run({"/bin/ping", "-c", "1", "127.0.0.1"}).exitCode, 0);
}

TEST_F(SupportTest, CreatesPrograms) {
    const std::string path = "/var/packages/FailoverPair/target/sbin/ternha";
    createProgram(path, "#!/bin/sh\nexit 4\n");
    EXPECT_EQ(run({path}).exitCode, 4);
}

TEST_F(SupportTest, CollectsWhatACommandSays) {
    const CommandResult result = run({"sh", "-c", "echo out; echo err >&2; kill -TERM $$"});
    EXPECT_EQ(result.output, "out\n");
    EXPECT_EQ(result.error, "err\n");
    EXPECT_EQ(result.status, SIGTERM);
    EXPECT_EQ(result.exitCode, 128 + SIGTERM);
}

TEST_F(SupportTest, ReportsAProgramThatCannotBeStarted) {
    try {
        run({"/no/such/program"});
        FAIL() << "started";
    } catch (const std::system_error& error) {
        EXPECT_EQ(error.code().value(), ENOENT);
    }
}

TEST_F(SupportTest, KeepsAProcessBesideTheTest) {
    Process process(
        {"sh", "-c", "trap 'echo stopped; exit 6' TERM; echo ready; while :; do sleep 0.01; done"});
    EXPECT_TRUE(eventually(30s, [&] { return process.output() == "ready\n"; }));
    EXPECT_EQ(process.waitFor(20ms), std::nullopt);
    process.signal(SIGTERM);
    const std::optional<int> status = process.waitFor(30s);
    ASSERT_TRUE(status);
    EXPECT_EQ(WEXITSTATUS(*status), 6);
    EXPECT_EQ(process.output(), "ready\nstopped\n");
}

TEST_F(SupportTest, EndsAProcessWithItsObject) {
    pid_t pid = -1;
    {
        const Process process({"sleep", "1234"});
        pid = process.pid();
        EXPECT_EQ(kill(pid, 0), 0);
    }
    EXPECT_EQ(kill(pid, 0), -1);
    EXPECT_EQ(errno, ESRCH);
}

TEST_F(SupportTest, CollectsTheSystemLog) {
    SystemLog log;
    EXPECT_THAT(log.entries(), IsEmpty());
    openlog("name", 0, LOG_DAEMON);
    // More than a socket queues.
    constexpr size_t kCount = 200;
    for (size_t i = 0; i < kCount; ++i) {
        syslog(LOG_ERR, "%s:%d text %zu", "other.cpp", 12, i);
    }
    const std::vector<SystemLog::Entry> entries = log.entries();
    ASSERT_EQ(entries.size(), kCount);
    EXPECT_EQ(entries.back().priority, LOG_DAEMON | LOG_ERR);
    EXPECT_EQ(entries.back().ident, "name");
    EXPECT_THAT(log.texts().back(), LogLine("other.cpp", "text 199"));
    EXPECT_TRUE(log.waitFor(kCount));
    EXPECT_FALSE(log.waitFor(kCount + 1, 20ms));
}

TEST_F(SupportTest, CollectsTheSystemLogOfOthers) {
    SystemLog log;
    EXPECT_EQ(run({"logger", "-p", "user.err", "-t", "tool", "hello: world"}).exitCode, 0);
    ASSERT_TRUE(log.waitFor(1));
    EXPECT_EQ(log.entries().front().priority, LOG_USER | LOG_ERR);
    EXPECT_EQ(log.entries().front().ident, "tool");
    EXPECT_EQ(log.entries().front().text, "hello: world");
}

TEST_F(SupportTest, ExchangesExactDatagrams) {
    UdpSocket a;
    UdpSocket b("127.0.0.2", 7499);
    EXPECT_EQ(b.port(), 7499);
    EXPECT_FALSE(b.receive(20ms));
    const std::string bytes("is_alive\0\xff", 10);
    a.send(bytes, "127.0.0.2", 7499);
    const std::optional<Datagram> received = b.receive(10s);
    ASSERT_TRUE(received);
    EXPECT_EQ(received->bytes, bytes);
    EXPECT_EQ(received->address, "127.0.0.1");
    EXPECT_EQ(received->port, a.port());
    b.send("", "127.0.0.1", a.port());
    const std::optional<Datagram> empty = a.receive(10s);
    ASSERT_TRUE(empty);
    EXPECT_EQ(empty->bytes, "");
}

class DeathTest : public SandboxTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(DeathTest, Works) {
    GTEST_FLAG_SET(death_test_style, GetParam());
    EXPECT_EXIT(_exit(5), ::testing::ExitedWithCode(5), "");
    EXPECT_DEATH(
        {
            std::fputs("last words\n", stderr);
            abort();
        },
        "last words");
}

INSTANTIATE_TEST_SUITE_P(Styles, DeathTest, ::testing::Values("fast", "threadsafe"),
                         [](const auto& style) { return std::string(style.param); });

}  // namespace
}  // namespace test
