#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <functional>
#include <thread>

#include "daemon_log.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using TERN::HA::Daemon::DaemonLog;
using test::LOG;
using ::testing::ElementsAre;

// A rotation whose compressor hangs holds the log's mutex.
class StuckLogTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        ASSERT_EQ(mkfifo("/tmp/gate", 0600), 0);
        // Only the first compressor hangs.
        test::replaceProgram("/bin/xz",
                             "[ -e /tmp/stuck ] && exit 1; : > /tmp/stuck; read line < /tmp/gate; exit 1");
        test::writeFile(LOG, "log\n");
        _holder = std::thread([this] { log.rotate(); });
        ASSERT_TRUE(test::eventually(10s, [] { return test::exists("/tmp/stuck"); }));
    }

    void TearDown() override {
        test::writeFile("/tmp/gate", "\n");
        _holder.join();
        test::SandboxTest::TearDown();
    }

    // The operation proceeds without the lock after the wait, which leaves the mutex to its holder.
    void expectToProceedAfterAMinute(const std::function<void()>& operation) {
        const test::Stopwatch stopwatch;
        operation();
        EXPECT_GE(stopwatch.elapsed(), 60s);
        EXPECT_LT(stopwatch.elapsed(), 80s);
        EXPECT_FALSE(log._mutex.try_lock());
    }

    DaemonLog log{"/var/log/ha", "/ha.daemon.log"};

 private:
    std::thread _holder;
};

TEST(LogLockTest, WaitIsSixtySeconds) {
    EXPECT_EQ(DaemonLog("/var/log/ha", "/ha.daemon.log")._lockTimeout, 60);
}

TEST_F(StuckLogTest, LineIsWrittenWithoutTheLockAfterAMinute) {
    expectToProceedAfterAMinute([this] { log.set("late"); });
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre("late"));
}

TEST_F(StuckLogTest, MoveProceedsWithoutTheLockAfterAMinute) {
    test::writeFile("/tmp/ha/ha.daemon.log", "buffered\n");
    expectToProceedAfterAMinute([this] { log.writeLogToDisk(); });
    EXPECT_EQ(test::readFile(LOG), "log\nbuffered\n");
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(StuckLogTest, RotationProceedsWithoutTheLockAfterAMinute) {
    test::writeFile(std::string(LOG) + ".3.xz", "archive");
    expectToProceedAfterAMinute([this] { log.rotate(); });
    EXPECT_EQ(test::readFile(std::string(LOG) + ".4.xz"), "archive");
}

TEST_F(StuckLogTest, OtherLogObjectDoesNotWait) {
    DaemonLog other("/var/log/ha", "/ha.daemon.log");
    const test::Stopwatch stopwatch;
    other.set("at once");
    EXPECT_LT(stopwatch.elapsed(), 30s);
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre("at once"));
    EXPECT_EQ(log.size(), 4);  // does not lock either
}

}  // namespace
