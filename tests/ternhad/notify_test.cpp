#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <csignal>

#include "support/sandbox.h"
#include "ternhad/daemon.h"

namespace {

using namespace std::chrono_literals;
using ::testing::MatchesRegex;

constexpr char PROGRAM[] = "/tmp/on-change";
constexpr char RESULT[] = "/tmp/changes";

// A daemon that runs a program of the test's at each change.
class NotifyTest : public ::testing::Test {
 protected:
    NotifyTest() { setResync(false); }

    static test::Process start(const std::string& script, const std::string& checkInterval = "0.2") {
        test::writeFile(PROGRAM, "#!/bin/bash\n" + script);
        EXPECT_EQ(chmod(PROGRAM, 0755), 0);
        auto arguments = test::daemonArguments("127.0.0.1", "127.0.0.2", "lo", {"--notify", PROGRAM});
        std::replace(arguments.begin(), arguments.end(), std::string("0.2"), checkInterval);
        test::Process daemon(arguments);
        EXPECT_TRUE(test::eventually(10s, [] { return !test::statusAt().isNull(); })) << daemon.error();
        return daemon;
    }

    static void setResync(bool isResync) {
        test::writeFile("/sys/block/md0/md/sync_action", isResync ? "resync\n" : "idle\n");
    }

    static std::string result() { return test::exists(RESULT) ? test::readFile(RESULT) : ""; }

    static bool eventuallyHas(const std::string& text, std::chrono::milliseconds limit = 20s) {
        return test::eventually(limit, [&] { return result().find(text) != std::string::npos; });
    }

    static bool eventuallyLogs(const std::string& text, std::chrono::milliseconds limit = 20s) {
        return test::eventually(limit, [&] { return test::wholeLog().find(text) != std::string::npos; });
    }
};

TEST_F(NotifyTest, RunsAtEachChangeWithItsEnvironment) {
    auto daemon = start("echo \"$EVENT $OLD $NEW $TIME $PEER\" >>/tmp/changes\n");
    EXPECT_TRUE(eventuallyHas("resync unknown no-resync "));
    setResync(true);
    EXPECT_TRUE(eventuallyHas("resync no-resync resync "));
    const std::string text = result();
    EXPECT_THAT(text.substr(text.find("resync no-resync resync ")),
                MatchesRegex("resync no-resync resync [0-9]+ 127\\.0\\.0\\.2\n(.|\n)*"));
    EXPECT_TRUE(eventuallyHas("peer unknown peer-dead "));
    EXPECT_TRUE(eventuallyLogs("Ran /tmp/on-change for resync: exit code 0\n"));
}

TEST_F(NotifyTest, RunsOneAtATimeInOrder) {
    auto daemon = start(
        "mkdir /tmp/busy || echo OVERLAP >>/tmp/changes\necho $NEW >>/tmp/changes\nsleep 0.1\nrmdir "
        "/tmp/busy\n");
    EXPECT_TRUE(eventuallyHas("no-resync\n"));
    for (int i = 0; i < 4; ++i) {
        setResync(i % 2 == 0);
        EXPECT_TRUE(
            test::eventually(10s, [&] { return test::statusAt()["isMDResync"].asBool() == (i % 2 == 0); }));
    }
    EXPECT_TRUE(test::eventually(20s, [] {
        std::string resyncs;
        for (const std::string& line : test::lines(result())) {
            if (line == "resync" || line == "no-resync") {
                resyncs += line + ' ';
            }
        }
        return resyncs == "no-resync resync no-resync resync no-resync ";
    })) << result();
    EXPECT_EQ(result().find("OVERLAP"), std::string::npos);
}

TEST_F(NotifyTest, FailedOrHungProgramIsLoggedAndDelaysNothing) {
    auto daemon = start(
        "[ $NEW != no-resync ] || exit 7\n[ $NEW != resync ] || { echo $$ >/tmp/changes; exec sleep 1000; "
        "}\n");
    EXPECT_TRUE(eventuallyLogs("Ran /tmp/on-change for no-resync: exit code 7\n"));
    setResync(true);
    EXPECT_TRUE(test::eventually(10s, [] { return test::statusAt()["isMDResync"].asBool(); }));
    setResync(false);
    EXPECT_TRUE(test::eventually(10s, [] { return !test::statusAt()["isMDResync"].asBool(); }));
    EXPECT_TRUE(eventuallyLogs("Killed /tmp/on-change for resync after 30 seconds\n", 60s));
    EXPECT_EQ(kill(std::stoi(result()), 0), -1);
}

TEST_F(NotifyTest, ChangesBeyondTheQueueAreLogged) {
    // The program waits until more has changed than the queue holds: 256, of two flags.
    auto daemon = start("until [ -e /tmp/go ]; do sleep 0.05; done\n", "0.05");
    const auto change = [](bool isTrouble) {
        setResync(isTrouble);
        test::writeFile("/proc/drbd", isTrouble ? "" : " 0: cs:Connected ro:Primary/Secondary\n");
        return test::eventually(20s, [=] {
            const Json::Value status = test::statusAt();
            return status["isMDResync"].asBool() == isTrouble &&
                   status["isDRBDConnect"].asBool() != isTrouble;
        });
    };
    for (int i = 0; i < 140; ++i) {
        ASSERT_TRUE(change(i % 2 == 0));
    }
    test::writeFile("/tmp/go", "");
    EXPECT_TRUE(eventuallyLogs("Notifications lost: "));
    EXPECT_TRUE(eventuallyLogs("Ran /tmp/on-change for connected: exit code 0\n"));
}

TEST_F(NotifyTest, ProgramGetsNoBlockedSignals) {
    auto daemon = start("grep SigBlk /proc/self/status >/tmp/changes\n");
    EXPECT_TRUE(eventuallyHas("SigBlk:\t0000000000000000\n"));
}

TEST_F(NotifyTest, RunningProgramDoesNotDelayTheStop) {
    auto daemon = start("echo $$ >/tmp/changes; exec sleep 1000\n");
    EXPECT_TRUE(test::eventually(10s, [] { return !result().empty(); }));
    daemon.signal(SIGTERM);
    EXPECT_EQ(daemon.waitFor(20s), 0);
    EXPECT_TRUE(test::eventually(10s, [] { return kill(std::stoi(result()), 0) == -1; }));
}

TEST_F(NotifyTest, EachChangeIsALineOfTheJournalWithItsLevel) {
    // Standard error is the journal's when systemd has named it so.
    test::writeFile(RESULT, "");
    struct stat journal = {};
    ASSERT_EQ(stat(RESULT, &journal), 0);
    test::Process daemon(
        {"/bin/bash", "-c",
         "export JOURNAL_STREAM=" + std::to_string(journal.st_dev) + ':' + std::to_string(journal.st_ino) +
             "; exec " TERNHAD
             " --local-ip 127.0.0.1 --remote-ip 127.0.0.2 --interface lo --check-interval 0.2 "
             "2>>/tmp/changes"});
    EXPECT_TRUE(eventuallyHas("<5>no-resync (was unknown)\n"));
    EXPECT_TRUE(eventuallyHas("<4>peer-dead (was unknown)\n"));
    setResync(true);
    EXPECT_TRUE(eventuallyHas("<4>resync (was no-resync)\n"));
    setResync(false);
    EXPECT_TRUE(eventuallyHas("<5>no-resync (was resync)\n"));
}

}  // namespace
