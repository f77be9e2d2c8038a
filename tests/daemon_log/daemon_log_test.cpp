#include "daemon_log.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <ostream>
#include <thread>

#include "daemon_log/other_unit.h"
#include "faults/clock.h"
#include "ha_log.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"

namespace {

using namespace std::string_literals;
using TERN::HA::Daemon::DaemonLog;
using test::BUFFER;
using test::LOG;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::SizeIs;

class DaemonLogTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        setenv("TZ", "UTC0", 1);
    }

    void setAt(std::time_t time, const char* text) {
        const test::FixedTime now(time);
        log.set(text);
    }

    DaemonLog log{"/var/log/ha", "/ha.daemon.log"};
};

// ---- Lines and their time stamps ----

TEST_F(DaemonLogTest, LineIsTimeStampSpaceTextNewline) {
    const test::FixedTime now(1794730821);
    setenv("TZ", "CET-1", 1);
    log.set("util.cpp:88 Failed to get ha hostname");
    EXPECT_EQ(test::readFile(BUFFER), "2026-11-15T09:20:21+01:00 util.cpp:88 Failed to get ha hostname\n");
}

struct Zone {
    const char* tz;
    const char* stamp;  // of 2026-11-15 08:20:21 UTC
};

void PrintTo(const Zone& zone, std::ostream* stream) {
    *stream << zone.tz;
}

class ZoneTest : public DaemonLogTest, public ::testing::WithParamInterface<Zone> {};

TEST_P(ZoneTest, TimeStampEndsInTheOffset) {
    const test::FixedTime now(1794730821);
    setenv("TZ", GetParam().tz, 1);
    log.set("x");
    EXPECT_EQ(test::readFile(BUFFER), std::string(GetParam().stamp) + " x\n");
}

INSTANTIATE_TEST_SUITE_P(Zones, ZoneTest,
                         ::testing::Values(Zone{"UTC0", "2026-11-15T08:20:21+00:00"},
                                           Zone{"NST3:30", "2026-11-15T04:50:21-03:30"},
                                           Zone{"IST-5:30", "2026-11-15T13:50:21+05:30"},
                                           Zone{"NPT-5:45", "2026-11-15T14:05:21+05:45"},
                                           Zone{"LINT-14", "2026-11-15T22:20:21+14:00"},
                                           Zone{"AOE12", "2026-11-14T20:20:21-12:00"}));

TEST_F(DaemonLogTest, TimeStampIsCorrectAfter2038) {
    const test::FixedTime now(2177452800);
    log.set("x");
    EXPECT_EQ(test::readFile(BUFFER), "2039-01-01T00:00:00+00:00 x\n");
}

TEST_F(DaemonLogTest, TimeStampFollowsTheTzVariable) {
    setAt(1794730821, "first");
    setenv("TZ", "CET-1", 1);
    setAt(1794730822, "second");
    EXPECT_EQ(test::readFile(BUFFER), "2026-11-15T08:20:21+00:00 first\n2026-11-15T09:20:22+01:00 second\n");
}

TEST_F(DaemonLogTest, TimeStampFollowsTheTzVariableWithinOneSecond) {
    const std::string kolkata = ":/usr/share/zoneinfo/" + std::string(60, '/') + "Asia/Kolkata";
    setAt(1794730821, "first");
    setenv("TZ", "CET-1", 1);
    setAt(1794730821, "second");
    setenv("TZ", "", 1);
    setAt(1794730821, "third");
    setenv("TZ", kolkata.c_str(), 1);
    setAt(1794730821, "fourth");
    setenv("TZ", (kolkata.substr(0, kolkata.size() - 12) + "America/Phoenix").c_str(), 1);
    setAt(1794730821, "fifth");
    EXPECT_EQ(test::readFile(BUFFER),
              "2026-11-15T08:20:21+00:00 first\n2026-11-15T09:20:21+01:00 second\n"
              "2026-11-15T08:20:21+00:00 third\n2026-11-15T13:50:21+05:30 fourth\n"
              "2026-11-15T01:20:21-07:00 fifth\n");
}

TEST_F(DaemonLogTest, TimeStampIsCorrectBefore1970) {
    setAt(-1, "x");
    EXPECT_EQ(test::readFile(BUFFER), "1969-12-31T23:59:59+00:00 x\n");
}

TEST_F(DaemonLogTest, TimeStampFollowsEtcLocaltime) {
    unsetenv("TZ");
    test::removeTree("/etc/localtime");
    std::filesystem::create_symlink("/usr/share/zoneinfo/Asia/Kolkata", "/etc/localtime");
    setAt(1794730821, "first");
    test::removeTree("/etc/localtime");
    std::filesystem::create_symlink("/usr/share/zoneinfo/America/Phoenix", "/etc/localtime");
    setAt(1794730822, "second");
    EXPECT_EQ(test::readFile(BUFFER), "2026-11-15T13:50:21+05:30 first\n2026-11-15T01:20:22-07:00 second\n");
}

TEST_F(DaemonLogTest, TimeStampFollowsABackwardClockStep) {
    setAt(1794730821, "first");
    setAt(1794730820, "second");
    setAt(1794730821, "third");
    EXPECT_EQ(test::readFile(BUFFER),
              "2026-11-15T08:20:21+00:00 first\n2026-11-15T08:20:20+00:00 second\n"
              "2026-11-15T08:20:21+00:00 third\n");
}

TEST_F(DaemonLogTest, TimeStampIsTheCurrentTime) {
    const std::time_t before = std::time(nullptr);
    log.set("x");
    const std::time_t after = std::time(nullptr);
    std::tm stamp = {};
    ASSERT_NE(strptime(test::readFile(BUFFER).c_str(), "%Y-%m-%dT%H:%M:%S+00:00 x", &stamp), nullptr);
    EXPECT_GE(timegm(&stamp), before);
    EXPECT_LE(timegm(&stamp), after);
}

TEST_F(DaemonLogTest, TimeZoneIsReadOncePerSecond) {
    // Names of 64 characters and more are not cached.
    for (const auto& [length, looks] :
         {std::pair(4, 1), std::pair(63, 1), std::pair(64, 3), std::pair(5, 1)}) {
        setenv("TZ", ("X" + std::string(static_cast<std::size_t>(length) - 2, 'X') + "0").c_str(), 1);
        const int before = test::timeZoneReads();
        for (int i = 0; i < 3; ++i) {
            setAt(1794730821, "line");
        }
        EXPECT_EQ(test::timeZoneReads() - before, looks) << length;
    }
    const int before = test::timeZoneReads();
    setAt(1794730822, "line");
    EXPECT_EQ(test::timeZoneReads() - before, 1);
}

TEST_F(DaemonLogTest, TextIsKeptByteForByte) {
    const test::FixedTime now(1794730821);
    const std::string text = "\n{}\n\0\xff%s\r\n"s;
    log.set(text);
    EXPECT_EQ(test::readFile(BUFFER), "2026-11-15T08:20:21+00:00 " + text + "\n");
}

TEST_F(DaemonLogTest, LineIsDroppedWithoutTheDirectory) {
    test::removeTree("/tmp/ha");
    log.set("lost");
    EXPECT_FALSE(test::exists("/tmp/ha"));
    test::makeDirectories("/tmp/ha");
    log.set("kept");
    EXPECT_THAT(test::messages(test::readFile(BUFFER)), ElementsAre("kept"));
}

TEST_F(DaemonLogTest, LineIsDroppedWhileTheBufferIsADirectory) {
    test::makeDirectories(BUFFER);
    log.set("lost");
    test::removeTree(BUFFER);
    log.set("kept");
    EXPECT_THAT(test::messages(test::readFile(BUFFER)), ElementsAre("kept"));
}

// ---- Objects ----

TEST_F(DaemonLogTest, EachSourceFileHasItsOwnLogObjects) {
    EXPECT_NE(TERN::HA::Daemon::daemonLog, test::otherDaemonLog());
    EXPECT_NE(TERN::HA::Daemon::recordLog, test::otherRecordLog());
    HA_LOG("here");
    test::logFromOtherUnit("there");
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre(test::LogLine("daemon_log_test.cpp", "here"),
                                                       test::LogLine("other_unit.cpp", "there")));
}

TEST_F(DaemonLogTest, LogObjectsPrecedeOtherStaticObjects) {
    EXPECT_TRUE(test::wereLogsReadyDuringInitialisation());
}

TEST_F(DaemonLogTest, LogLineNamesItsCallSite) {
    const int line = __LINE__ + 1;
    HA_LOG("message");
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre("daemon_log_test.cpp:" + std::to_string(line) + " message"));
}

TEST_F(DaemonLogTest, LoggingWorksDuringStaticDestruction) {
    const auto probe = test::run({LOG_PROBE, "end"});
    EXPECT_EQ(probe.exitCode, 0) << probe.error;
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre("last word"));
}

TEST_F(DaemonLogTest, FilesAreNamedByTheArguments) {
    test::makeDirectories("/var/other");
    DaemonLog other("/var/other", "/x.log");
    other.set("x");
    EXPECT_THAT(test::messages(test::readFile("/tmp/ha/x.log")), ElementsAre("x"));
    other.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile("/var/other/x.log")), ElementsAre("x"));
    EXPECT_FALSE(test::exists(BUFFER));
}

TEST_F(DaemonLogTest, RecordLogHasItsOwnFile) {
    TERN::HA::Daemon::recordLog->set("snapshot");
    EXPECT_FALSE(test::exists(BUFFER));
    TERN::HA::Daemon::recordLog->writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile("/var/log/ha/ha.daemon.record")), ElementsAre("snapshot"));
}

// ---- Concurrent writers ----

void logLines(char letter, int count) {
    DaemonLog log("/var/log/ha", "/ha.daemon.log");
    for (int i = 0; i < count; ++i) {
        log.set(std::string(100000, letter));
    }
}

void expectWholeLines(int countOfEach) {
    const std::vector<std::string> messages = test::daemonLogMessages();
    EXPECT_THAT(messages, SizeIs(2 * countOfEach));
    for (const char letter : {'a', 'b'}) {
        EXPECT_EQ(std::count(messages.begin(), messages.end(), std::string(100000, letter)), countOfEach);
    }
}

TEST_F(DaemonLogTest, LongLinesOfTwoThreadsAreNotTorn) {
    std::thread a(logLines, 'a', 100);
    std::thread b(logLines, 'b', 100);
    a.join();
    b.join();
    expectWholeLines(100);
}

TEST_F(DaemonLogTest, LongLinesOfTwoProcessesAreNotTorn) {
    const pid_t child = fork();
    if (child == 0) {
        logLines('a', 100);
        _exit(0);
    }
    logLines('b', 100);
    int status = -1;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
    expectWholeLines(100);
}

TEST_F(DaemonLogTest, LinesOfEachThreadStayInOrder) {
    constexpr int THREADS = 8;
    constexpr int LINES = 200;
    std::vector<std::thread> threads;
    for (int i = 0; i < THREADS; ++i) {
        threads.emplace_back([this, i] {
            for (int number = 0; number < LINES; ++number) {
                log.set(std::to_string(i) + " " + std::to_string(number));
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    std::vector<std::vector<std::string>> seen(THREADS);
    for (const std::string& message : test::daemonLogMessages()) {
        seen.at(static_cast<std::size_t>(message.at(0) - '0')).push_back(message);
    }
    for (int i = 0; i < THREADS; ++i) {
        std::vector<std::string> expected;
        for (int number = 0; number < LINES; ++number) {
            expected.push_back(std::to_string(i) + " " + std::to_string(number));
        }
        EXPECT_EQ(seen.at(static_cast<std::size_t>(i)), expected);
    }
}

// ---- Moving to disk ----

TEST_F(DaemonLogTest, MoveAppendsBufferedLinesInOrder) {
    test::writeFile(LOG, "older\n");
    log.set("one");
    log.set("two");
    const std::string buffered = test::readFile(BUFFER);
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(LOG), "older\n" + buffered);
    EXPECT_EQ(test::readFile(BUFFER), "");
}

TEST_F(DaemonLogTest, MoveWithoutABufferCreatesAnEmptyOne) {
    test::writeFile(LOG, "older\n");
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(LOG), "older\n");
    EXPECT_EQ(test::readFile(BUFFER), "");
}

TEST_F(DaemonLogTest, MoveWithoutFilesCreatesBoth) {
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(LOG), "");
    EXPECT_EQ(test::readFile(BUFFER), "");
}

TEST_F(DaemonLogTest, MoveWithoutALogDirectoryEmptiesTheBuffer) {
    test::removeTree("/var/log/ha");
    log.set("lost");
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(BUFFER), "");
    test::makeDirectories("/var/log/ha");
    log.set("kept");
    log.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile(LOG)), ElementsAre("kept"));
}

TEST_F(DaemonLogTest, MoveEmptiesTheBufferWhenTheLogIsADirectory) {
    test::makeDirectories(LOG);
    log.set("lost");
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(BUFFER), "");
}

TEST_F(DaemonLogTest, MoveDoesNothingWhenTheBufferIsADirectory) {
    test::makeDirectories(BUFFER);
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(LOG), "");
}

TEST_F(DaemonLogTest, MoveWaits100msForTheEndOfALine) {
    test::writeFile(BUFFER, "x");
    const test::NoSleep noSleep;
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(LOG), "x\n");
    EXPECT_EQ(test::NoSleep::total(), std::chrono::milliseconds(100));
}

TEST_F(DaemonLogTest, MoveDoesNotWaitWithoutALog) {
    test::writeFile(BUFFER, "the beginning of a line");
    test::removeTree("/var/log/ha");
    const test::NoSleep noSleep;
    log.writeLogToDisk();
    EXPECT_EQ(test::NoSleep::total(), std::chrono::milliseconds(0));
}

TEST_F(DaemonLogTest, MoveTerminatesAnIncompleteLastLine) {
    test::writeFile(BUFFER, "whole\ntorn");
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(LOG), "whole\ntorn\n");
}

TEST_F(DaemonLogTest, MoveKeepsEmptyLinesAndZeroBytes) {
    const std::string text("\n\na\0b\n\n", 7);
    test::writeFile(BUFFER, text);
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(LOG), text);
}

TEST_F(DaemonLogTest, MoveKeepsLinesOfAnyLength) {
    std::string text;
    for (const std::size_t length : {65534U, 65535U, 65536U, 65537U, 1U, 200000U, 0U, 131072U}) {
        text += std::string(length, 'x') + '\n';
    }
    test::writeFile(BUFFER, text);
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(LOG), text);
}

TEST_F(DaemonLogTest, ConcurrentMoveTearsNoLine) {
    std::thread writer(logLines, 'a', 200);
    DaemonLog other("/var/log/ha", "/ha.daemon.log");
    for (int i = 0; i < 50; ++i) {
        other.writeLogToDisk();
    }
    writer.join();
    other.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile(LOG)), Each(std::string(100000, 'a')));
}

}  // namespace
