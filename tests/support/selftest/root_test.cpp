#include <sys/stat.h>
#include <unistd.h>

#include "launcher.h"
#include "support/files.h"
#include "support/sandbox.h"

using ::testing::AllOf;
using ::testing::ContainsRegex;
using ::testing::HasSubstr;
using ::testing::StartsWith;

namespace test {
namespace {

class RootTest : public SandboxTest {};

mode_t modeOf(const std::string& path) {
    struct stat status = {};
    EXPECT_EQ(stat(path.c_str(), &status), 0) << path;
    return status.st_mode & 07777U;
}

TEST_F(RootTest, HasTheDirectoriesOfAFreshSystem) {
    EXPECT_EQ(modeOf("/tmp"), 01777U);
    EXPECT_EQ(modeOf("/var"), 0755U);
    EXPECT_EQ(modeOf("/var/log"), 0755U);
    EXPECT_EQ(modeOf("/run"), 0755U);
    EXPECT_EQ(modeOf("/root"), 0700U);
    EXPECT_EQ(modeOf("/home"), 0755U);
    EXPECT_EQ(modeOf("/dev/shm"), 01777U);
    EXPECT_FALSE(exists("/dev/log"));
    EXPECT_FALSE(exists("/usr/tern"));
    // The project itself may lie in /home or /root.
    EXPECT_EQ(run({"ls", "-A", "/run", "/sys/block", "/sys/class/ata_port"}).output,
              "/run:\n\n/sys/block:\n\n/sys/class/ata_port:\n");
}

TEST_F(RootTest, HasDevices) {
    EXPECT_EQ(run({"sh", "-c", "echo lost > /dev/null; head -c 2 /dev/zero | od -An -tx1"}).output,
              " 00 00\n");
    EXPECT_THAT(run({"sh", "-c", "head -c 1 /dev/zero > /dev/full"}).error,
                HasSubstr("No space left on device"));
    EXPECT_EQ(run({"sh", "-c", "head -c 16 /dev/urandom | wc -c"}).output, "16\n");
    EXPECT_EQ(run({"sh", "-c", "echo text > /dev/stderr"}).error, "text\n");
    EXPECT_EQ(run({"script", "-qc", "tty", "/dev/null"}).output, "/dev/pts/0\r\n");
}

TEST_F(RootTest, ProcIsWritable) {
    EXPECT_FALSE(exists("/proc/drbd"));
    writeFile("/proc/drbd", " 0: cs:Connected ro:Primary/Secondary\n");
    EXPECT_EQ(run({"cat", "/proc/drbd"}).output, " 0: cs:Connected ro:Primary/Secondary\n");
}

TEST_F(RootTest, TheSystemRequestTriggerIsAPlainFile) {
    EXPECT_EQ(readFile("/proc/sysrq-trigger"), "");
    struct stat status = {};
    ASSERT_EQ(lstat("/proc/sysrq-trigger", &status), 0);
    EXPECT_TRUE(S_ISREG(status.st_mode));
    writeFile("/proc/sysrq-trigger", "b");
    EXPECT_EQ(readFile("/proc/sysrq-trigger"), "b");
}

TEST_F(RootTest, MemoryFiguresCanBeReplacedAndRemoved) {
    EXPECT_THAT(readFile("/proc/meminfo"), StartsWith("MemTotal:"));
    writeFile("/proc/meminfo", "MemTotal: 1 kB\n");
    EXPECT_EQ(run({"cat", "/proc/meminfo"}).output, "MemTotal: 1 kB\n");
    removeTree("/proc/meminfo");
    EXPECT_FALSE(exists("/proc/meminfo"));
    EXPECT_THAT(run({"/bin/ps", "-eo", "pid,ppid,stat,rss,cputime,args"}).output, HasSubstr("/bin/ps -eo"));
}

TEST_F(RootTest, ProcessListingWorks) {
    const CommandResult result = run({"/bin/ps", "-eo", "pid,ppid,stat,rss,cputime,args"});
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_EQ(result.error, "");
    EXPECT_THAT(lines(result.output).front(), ContainsRegex("^ +PID +PPID STAT +RSS +TIME COMMAND$"));
    EXPECT_THAT(result.output, AllOf(HasSubstr(ownProgram()), HasSubstr("/bin/ps -eo pid")));
}

TEST_F(RootTest, FileSystemListingWorks) {
    const CommandResult result = run({"/bin/df"});
    EXPECT_EQ(result.exitCode, 0) << result.error;
    EXPECT_THAT(result.output, AllOf(StartsWith("Filesystem "), ContainsRegex("\ntmpfs .* /tmp\n")));
}

TEST_F(RootTest, PingReachesTheLoopback) {
    const CommandResult result = run({"/bin/ping", "-c", "1", "127.0.0.1"});
    EXPECT_EQ(result.exitCode, 0) << result.error;
    EXPECT_THAT(result.output, HasSubstr("1 packets transmitted, 1 received, 0% packet loss"));
}

TEST_F(RootTest, InterfaceListingWorks) {
    const CommandResult result = run({"/sbin/ifconfig", "-s"});
    EXPECT_EQ(result.exitCode, 0) << result.error;
    EXPECT_EQ(lines(result.output).size(), 2U);
    EXPECT_THAT(result.output, AllOf(StartsWith("Iface "), HasSubstr("\nlo ")));
}

TEST_F(RootTest, LogsAndBuffersAreOnDifferentFileSystems) {
    writeFile("/tmp/ha/file", "");
    EXPECT_EQ(rename("/tmp/ha/file", "/var/log/ha/file"), -1);
    EXPECT_EQ(errno, EXDEV);
}

}  // namespace
}  // namespace test
