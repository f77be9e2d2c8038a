#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/time.h>
#include <unistd.h>

#include <cerrno>

#include "checker.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"

namespace {

using namespace TERN::HA::Daemon;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::MatchesRegex;
using ::testing::StartsWith;

class RecordingTest : public test::SandboxTest {
 protected:
    static void record(const std::string& script) {
        test::createProgram("/opt/program", script);
        const char* const argv[] = {"/opt/program", "first", "second", nullptr};
        recordCMD(argv);
    }
};

TEST_F(RecordingTest, EntryIsTimeStampOutputAndEmptyLine) {
    test::replaceProgram("/bin/df", "echo Filesystem; echo tmpfs; echo $# arguments");
    recordDF();
    EXPECT_THAT(test::recordText(),
                MatchesRegex("....-..-..T..:..:..[+-]..:.. \nFilesystem\ntmpfs\n0 arguments\n\n"));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(RecordingTest, ProgramGetsItsArguments) {
    record("echo \"$0 $*\"");
    EXPECT_THAT(test::recordEntries(), ElementsAre("\n/opt/program first second\n"));
}

TEST_F(RecordingTest, EmptyOutputIsRecorded) {
    record("exit 0");
    EXPECT_THAT(test::recordText(), EndsWith(" \n\n"));
    EXPECT_THAT(test::recordEntries(), ElementsAre("\n"));
}

TEST_F(RecordingTest, LongLinesAreRecordedWhole) {
    record("printf '%0511d' 0; printf '%01000d' 0; echo end; printf '%0600d' 0");
    EXPECT_THAT(test::recordEntries(),
                ElementsAre("\n" + std::string(1511, '0') + "end\n" + std::string(600, '0')));
}

TEST_F(RecordingTest, EveryByteIsRecorded) {
    record("printf 'a\\000b\\nc\\377\\n'");
    EXPECT_THAT(test::recordEntries(), ElementsAre(std::string("\na\0b\nc\377\n", 8)));
}

TEST_F(RecordingTest, SignalsDoNotTruncateTheOutput) {
    struct sigaction action = {};
    action.sa_handler = [](int) {};  // without SA_RESTART
    ASSERT_EQ(sigaction(SIGALRM, &action, nullptr), 0);
    const itimerval interval = {{0, 20000}, {0, 20000}};
    ASSERT_EQ(setitimer(ITIMER_REAL, &interval, nullptr), 0);
    record("echo one; sleep 0.5; echo two");
    const itimerval none = {};
    ASSERT_EQ(setitimer(ITIMER_REAL, &none, nullptr), 0);
    EXPECT_THAT(test::recordEntries(), ElementsAre("\none\ntwo\n"));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(RecordingTest, EarlierErrnoIsIgnored) {
    test::createProgram("/opt/program", "echo one");
    const char* const argv[] = {"/opt/program", nullptr};
    errno = EINTR;
    recordCMD(argv);
    EXPECT_THAT(test::recordEntries(), ElementsAre("\none\n"));
}

TEST_F(RecordingTest, OnlyStandardOutputIsRecorded) {
    record("echo error >&2; echo output");
    EXPECT_THAT(test::recordEntries(), ElementsAre("\noutput\n"));
}

TEST_F(RecordingTest, OutputIsRecordedBeforeTheExitStatusIsLogged) {
    // The program ends only after its output has reached the record log.
    record("echo output; exec >&-; while [ ! -s /tmp/ha/ha.daemon.record ]; do :; done; exit 4");
    EXPECT_THAT(test::recordEntries(), ElementsAre("\noutput\n"));
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec /opt/program return code: 1024")));
}

TEST_F(RecordingTest, StartFailureLogsTwoLinesAndRecordsNothing) {
    const char* const argv[] = {"/nowhere/program", nullptr};
    recordCMD(argv);
    EXPECT_EQ(test::recordText(), "");
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec command: /nowhere/program"),
                            test::LogLine("checker.cpp", "Failed to exec ifconfig to get interface status")));
}

TEST_F(RecordingTest, RealPsListsThisProcess) {
    recordPS();
    ASSERT_EQ(test::recordEntries().size(), 1U);
    const std::string entry = test::recordEntries()[0];
    const auto lines = test::lines(entry);
    EXPECT_THAT(lines[1], MatchesRegex(" *PID +PPID STAT +RSS +TIME COMMAND"));
    EXPECT_THAT(entry, HasSubstr("/bin/ps -eo pid,ppid,stat,rss,cputime,args"));
    EXPECT_THAT(lines, ::testing::Contains(MatchesRegex(" *" + std::to_string(getpid()) + " .*")));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(RecordingTest, RealDfListsTheRootFileSystem) {
    recordDF();
    ASSERT_EQ(test::recordEntries().size(), 1U);
    EXPECT_THAT(test::recordEntries()[0], StartsWith("\nFilesystem"));
    EXPECT_THAT(test::recordEntries()[0], HasSubstr(" /\n"));
}

TEST_F(RecordingTest, StatusIsRecordedAsJson) {
    Status status;
    status.isMDResync = true;
    recordStatus(status);
    EXPECT_THAT(
        test::recordEntries(),
        ElementsAre("\n"
                    R"({"diskErrorHandlingDisk":[],"diskErrorHandlingDiskRemote":[],"heartbeatLatency":0.0,)"
                    R"("heartbeatPacketFailRate":0.0,"isDRBDConnect":true,"isDiskErrHandling":false,)"
                    R"("isMDResync":true,"isRemoteAlive":false,"isRemoteDiskErrHandling":false,)"
                    R"("isRemoteMDResync":false})"));
}

TEST_F(RecordingTest, MeminfoIsRecordedVerbatim) {
    const std::string meminfo = "MemTotal:  1 kB\n\nodd line\n" + std::string(10000, 'x') + "\n";
    test::writeFile("/proc/meminfo", meminfo);
    recordMemoryInfo();
    EXPECT_THAT(test::recordEntries(), ElementsAre("\n" + meminfo));
}

TEST_F(RecordingTest, EmptyMeminfoIsRecorded) {
    test::writeFile("/proc/meminfo", "");
    recordMemoryInfo();
    EXPECT_THAT(test::recordEntries(), ElementsAre("\n"));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(RecordingTest, MissingMeminfoIsLoggedAndNotRecorded) {
    test::removeTree("/proc/meminfo");
    recordMemoryInfo();
    EXPECT_EQ(test::recordText(), "");
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to get meminfo")));
}

TEST_F(RecordingTest, UnopenableRecordLogIsNotLogged) {
    test::makeDirectories("/tmp/ha/ha.daemon.record");
    recordMemoryInfo();
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

}  // namespace
