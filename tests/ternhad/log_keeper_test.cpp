#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>

#include "ternhad/sick_machine.h"

namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;
using ::testing::Not;

class LogKeeperTest : public test::SickMachineTest {
 protected:
    // Kills the log keeper and waits for the next.
    void replaceKeeper() {
        const pid_t keeper = test::childOf(daemon->pid());
        ASSERT_GT(keeper, 0);
        kill(keeper, SIGKILL);
        ASSERT_TRUE(test::eventually(20s, [&] {
            const pid_t next = test::childOf(daemon->pid());
            return next > 0 && next != keeper;
        }));
    }
};

TEST_F(LogKeeperTest, HungLogDiskDelaysNeitherStopNorRestart) {
    start({"--log-interval", "0.1"});
    test::hang(test::LOG_FILE);
    EXPECT_FALSE(test::eventually(1s, [] { return !isPeerAlive(); }));
    expectEndInTime();
    start();
    EXPECT_TRUE(replies("is_alive"));
    expectEndInTime();
}

TEST_F(LogKeeperTest, HungCompressionDelaysNoStopAndLosesNoLine) {
    test::replaceProgram("/bin/xz", ": > /tmp/compressing; exec sleep 60");
    start();
    daemon->signal(SIGHUP);
    ASSERT_TRUE(test::eventually(20s, [] { return test::exists("/tmp/compressing"); }));
    expectEndInTime();
    EXPECT_THAT(test::readFile(test::LOG_FILE), HasSubstr("Stopping"));
    EXPECT_NE(test::run({"pgrep", "sleep"}).exitCode, 0);
}

TEST_F(LogKeeperTest, IsRestartedWhenItDies) {
    start({"--log-interval", "3600"});
    ASSERT_NO_FATAL_FAILURE(replaceKeeper());
    daemon->signal(SIGHUP);
    EXPECT_TRUE(test::eventually(20s, [] { return test::exists("/var/log/ha/ha.daemon.log.0.xz"); }));
    EXPECT_THAT(test::wholeLog() + test::run({"xz", "-dc", "/var/log/ha/ha.daemon.log.0.xz"}).output,
                HasSubstr("The log keeper has exited: restarting it"));
    expectEndInTime();
}

TEST_F(LogKeeperTest, RestartsLeaveNoDescriptorOpen) {
    start();
    const auto descriptors = [this] {
        const std::filesystem::directory_iterator all("/proc/" + std::to_string(daemon->pid()) + "/fd");
        return std::distance(begin(all), end(all));
    };
    const auto before = descriptors();
    for (int i = 0; i < 5; ++i) {
        ASSERT_NO_FATAL_FAILURE(replaceKeeper());
    }
    // A program that runs takes two for a while.
    EXPECT_TRUE(test::eventually(10s, [&] { return descriptors() <= before; })) << descriptors();
    expectEndInTime();
}

TEST_F(LogKeeperTest, DeathJustBeforeTheStopLosesNoLine) {
    start({"--log-interval", "3600"});
    ASSERT_NO_FATAL_FAILURE(replaceKeeper());  // the new one has nothing to do
    const pid_t keeper = test::childOf(daemon->pid());
    ASSERT_GT(keeper, 0);
    daemon->signal(SIGSTOP);
    kill(keeper, SIGKILL);
    daemon->signal(SIGTERM);
    daemon->signal(SIGCONT);
    expectEndInTime();
    EXPECT_THAT(test::readFile(test::LOG_FILE), HasSubstr("Stopping"));
}

TEST_F(LogKeeperTest, MovesTheLogOnceInAnInterval) {
    start({"--log-interval", "8", "--dead-after", "0.6"});
    ASSERT_TRUE(test::eventually(30s, [] { return test::exists(test::LOG_FILE); }));
    const test::Stopwatch sinceMove;
    peer.reset();
    const std::string line = "changed to dead";
    ASSERT_TRUE(test::eventually(10s, [&] { return test::wholeLog().find(line) != std::string::npos; }));
    // On a machine that took too long the next move may have come.
    EXPECT_FALSE(test::eventually(1s, [&] {
        return sinceMove.elapsed() < 6s && test::readFile(test::LOG_FILE).find(line) != std::string::npos;
    }));
    expectEndInTime();
    EXPECT_THAT(test::readFile(test::LOG_FILE), HasSubstr(line));
}

TEST_F(LogKeeperTest, DiesWithTheDaemon) {
    start();
    const pid_t keeper = test::childOf(daemon->pid());
    ASSERT_GT(keeper, 0);
    daemon->signal(SIGKILL);
    EXPECT_TRUE(test::eventually(10s, [&] { return kill(keeper, 0) != 0; }));
}

TEST_F(LogKeeperTest, HoldsNoSocket) {
    start();
    const pid_t keeper = test::childOf(daemon->pid());
    for (const auto& entry : std::filesystem::directory_iterator("/proc/" + std::to_string(keeper) + "/fd")) {
        std::error_code gone;
        EXPECT_THAT(std::filesystem::read_symlink(entry.path(), gone).string(), Not(HasSubstr("socket:")));
    }
    expectEndInTime();
}

}  // namespace
