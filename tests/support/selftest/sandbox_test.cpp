#include "support/sandbox.h"

#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox_check.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using ::testing::AllOf;
using ::testing::ContainsRegex;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;
using ::testing::UnorderedElementsAre;

namespace test {
namespace {

using Words = std::vector<std::string>;

constexpr int LEFTOVERS = 97;
constexpr int OUTSIDE = 99;

std::string ownProgram() {
    return std::filesystem::read_symlink("/proc/self/exe");
}

// Tests of script/sandbox nest a sandbox in their own, which plays the machine.
class SandboxScriptTest : public SandboxTest {
 protected:
    static Words command(const std::string& script, const Words& options = {}) {
        Words words{SANDBOX};
        words.insert(words.end(), options.begin(), options.end());
        words.insert(words.end(), {"--", "/bin/sh", "-c", script});
        return words;
    }
    static CommandResult inside(const std::string& script, const Words& options = {}) {
        return run(command(script, options));
    }
    static std::string processList() { return run({"ps", "-eo", "args"}).output; }
};

TEST_F(SandboxScriptTest, PassesOutputAndExitCodeLikeAShell) {
    const CommandResult result = inside("echo out; echo err >&2; exit 7");
    EXPECT_EQ(result.output, "out\n");
    EXPECT_EQ(result.error, "err\n");
    EXPECT_EQ(result.exitCode, 7);
    EXPECT_EQ(inside("kill -KILL $$").exitCode, 128 + SIGKILL);
    EXPECT_EQ(inside("kill -SEGV $$").exitCode, 128 + SIGSEGV);
}

TEST_F(SandboxScriptTest, ReportsAStartFailure) {
    const CommandResult result = run({SANDBOX, "--", "/no/such/program"});
    EXPECT_EQ(result.exitCode, 127);
    EXPECT_THAT(result.error, HasSubstr("/no/such/program"));
}

TEST_F(SandboxScriptTest, PrintsHelpAndRejectsWrongOptions) {
    EXPECT_THAT(run({SANDBOX, "--help"}).output, HasSubstr("script/sandbox [OPTION]... -- PROGRAM"));
    for (const Words& words : {Words{},
                               {"--no-such-option", "--", "true"},
                               {"--bind", "relative", "--", "true"},
                               {"--bind", "/", "--", "true"},
                               {"--node", "alpha", "--", "true"}}) {
        Words wrong{SANDBOX};
        wrong.insert(wrong.end(), words.begin(), words.end());
        EXPECT_EQ(run(wrong).exitCode, 2) << ::testing::PrintToString(words);
    }
}

TEST_F(SandboxScriptTest, HidesTheFilesOfTheMachine) {
    for (const char* directory : {"/tmp", "/var/log", "/run", "/root", "/home"}) {
        writeFile(directory + std::string("/secret"), "");
    }
    const CommandResult result = inside("ls -A /tmp /var/log /run /root /home | grep secret");
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.output, "");
}

TEST_F(SandboxScriptTest, HidesTheNetworkOfTheMachine) {
    ASSERT_EQ(run({"ip", "link", "add", "eth8", "type", "veth", "peer", "name", "eth9"}).exitCode, 0);
    ASSERT_EQ(run({"ip", "address", "add", "10.9.9.1/24", "dev", "eth8"}).exitCode, 0);
    const CommandResult interfaces = inside("ip -oneline link | wc -l; ip -oneline link");
    EXPECT_THAT(interfaces.output, AllOf(StartsWith("1\n"), HasSubstr(": lo:"), HasSubstr("UP")));
    EXPECT_NE(inside("ping -c 1 -W 1 10.9.9.1").exitCode, 0);
}

TEST_F(SandboxScriptTest, HidesTheProcessesOfTheMachine) {
    const Process other({"sleep", "1234"});
    EXPECT_THAT(processList(), HasSubstr("sleep 1234"));
    EXPECT_THAT(inside("ps -eo args").output, AllOf(HasSubstr("ps -eo args"), Not(HasSubstr("sleep 1234"))));
    EXPECT_EQ(inside("hostname").output, "sandbox\n");
}

TEST_F(SandboxScriptTest, ProtectsTheFilesOfTheMachine) {
    EXPECT_NE(inside("touch /usr/bin/new").exitCode, 0);
    EXPECT_EQ(inside("mkdir -p /usr/tern/etc && touch /usr/tern/etc/new").exitCode, 0);
    EXPECT_FALSE(exists("/usr/tern"));
    EXPECT_EQ(inside("ln -sf /usr/share/zoneinfo/Asia/Tokyo /etc/localtime && date +%z").output, "+0900\n");
}

TEST_F(SandboxScriptTest, BindsDirectoriesAtTheirPaths) {
    writeFile("/tmp/tree/file", "text");
    makeDirectories("/tmp/tree/build");
    EXPECT_EQ(inside("cat /tmp/tree/file; touch /tmp/tree/build/new /tmp/tree/new 2>&1",
                     {"--bind", "/tmp/tree", "--bind-rw", "/tmp/tree/build"})
                  .output,
              "texttouch: cannot touch '/tmp/tree/new': Read-only file system\n");
    EXPECT_TRUE(exists("/tmp/tree/build/new"));
}

TEST_F(SandboxScriptTest, BoundDirectoriesAreAccessibleToOthersThanRoot) {
    if (!hasOtherUsers()) {
        GTEST_SKIP() << "needs users other than root";
    }
    EXPECT_EQ(
        run({"setpriv", "--reuid", "65534", "--clear-groups", ownProgram(), "--gtest_list_tests"}).exitCode,
        0);
}

TEST_F(SandboxScriptTest, KeepsTheWorkingDirectory) {
    makeDirectories("/tmp/tree");
    const std::string script = SANDBOX;
    EXPECT_EQ(run({"sh", "-c", "cd /tmp/tree && " + script + " --bind /tmp/tree -- pwd"}).output,
              "/tmp/tree\n");
    EXPECT_EQ(run({"sh", "-c", "cd /tmp/tree && " + script + " -- pwd"}).output, "/\n");
}

TEST_F(SandboxScriptTest, PassesACleanEnvironmentAndPersonality) {
    const CommandResult result =
        run({"env", "-i", "SECRET=1", "GTEST_COLOR=no", "GCOV_PREFIX=/x", "UBSAN_OPTIONS=print_stacktrace=1",
             SANDBOX, "--env", "EXTRA=2", "--env", "HOME=/home", "--", "/usr/bin/env"});
    EXPECT_THAT(lines(result.output),
                UnorderedElementsAre("PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin",
                                     "HOME=/home", "LANG=C.UTF-8", "TERM=dumb", "GTEST_COLOR=no",
                                     "GCOV_PREFIX=/x", "UBSAN_OPTIONS=print_stacktrace=1", "EXTRA=2"));
    EXPECT_EQ(inside("echo $HOME").output, "/root\n");
    EXPECT_EQ(inside("cat /proc/self/personality", {"--no-aslr"}).output, "00040000\n");
}

TEST_F(SandboxScriptTest, ClosesInheritedDescriptors) {
    const CommandResult result =
        run({"bash", "-c", "exec 3</dev/null 19</dev/null; exec /.machine/sandbox -- ls /proc/self/fd"});
    EXPECT_EQ(result.output, "0\n1\n2\n3\n") << "3 is the directory that is listed";
}

TEST_F(SandboxScriptTest, KillsAllItsProcesses) {
    for (const int signal : {SIGTERM, SIGINT, SIGKILL}) {
        Process sandbox(command("echo ready; sleep 1234"));
        ASSERT_TRUE(eventually(30s, [&] { return sandbox.output() == "ready\n"; }));
        EXPECT_THAT(processList(), HasSubstr("sleep 1234"));
        sandbox.signal(signal);
        EXPECT_EQ(sandbox.wait(), signal);
        EXPECT_TRUE(eventually(30s, [] { return processList().find("sleep 1234") == std::string::npos; }));
    }
}

TEST_F(SandboxScriptTest, ReportsAProcessThatOutlivesTheProgram) {
    CommandResult result = inside("sleep 0.3 & exit 5");
    EXPECT_EQ(result.exitCode, 5);
    EXPECT_EQ(result.error, "");
    const Stopwatch stopwatch;
    result = inside("setsid sleep 1234 & exit 0");
    EXPECT_EQ(result.exitCode, LEFTOVERS);
    EXPECT_THAT(result.error, ContainsRegex("^sandbox: left behind: process [0-9]+ \\(sleep 1234\\)\n$"));
    EXPECT_GE(stopwatch.elapsed(), 2s);
    EXPECT_TRUE(eventually(30s, [] { return processList().find("sleep 1234") == std::string::npos; }));
}

// A user namespace confines the limits to this test.
TEST_F(SandboxScriptTest, FailsWithoutMountsAndNamespaces) {
    const CommandResult unbound = inside("echo escaped", {"--bind", "/no/such/directory"});
    EXPECT_NE(unbound.exitCode, 0);
    EXPECT_EQ(unbound.output, "");
    EXPECT_THAT(unbound.error, HasSubstr("/no/such/directory"));
    for (const char* limit : {"max_pid_namespaces", "max_net_namespaces"}) {
        const CommandResult result = run({"unshare", "--user", "--map-root-user", "sh", "-c",
                                          std::string("echo 0 > /.kernel/proc/sys/user/") + limit +
                                              " && exec /.machine/sandbox -- sh -c 'echo escaped'"});
        EXPECT_NE(result.exitCode, 0) << limit;
        EXPECT_EQ(result.output, "") << limit;
        EXPECT_THAT(result.error, HasSubstr("namespace failed"));
    }
}

TEST_F(SandboxScriptTest, TestProgramRefusesToRunOutside) {
    EXPECT_EQ(run({ownProgram(), "--gtest_filter=None.*"}).exitCode, 0);
    EXPECT_EQ(run({"unshare", "--mount", ownProgram(), "--gtest_filter=None.*"}).exitCode, OUTSIDE);
    const CommandResult result =
        run({"sh", "-c", "rm /.ternha-sandbox; exec " + ownProgram() + " --gtest_filter=None.*"});
    EXPECT_EQ(result.exitCode, OUTSIDE);
    EXPECT_EQ(result.output.find("Running"), std::string::npos);
    EXPECT_THAT(result.error, StartsWith("refusing to run outside the sandbox"));
}

TEST_F(SandboxScriptTest, TestProgramRefusesARootOtherThanTmpfs) {
    makeDirectories("/tmp/root");
    const std::string directory = std::filesystem::path(ownProgram()).parent_path();
    const CommandResult result = run(
        {"sh", "-ec",
         "mount -t ramfs ramfs /tmp/root; cd /tmp/root; touch .ternha-sandbox; cp -P /bin /lib* .; "
         "for part in /usr /proc /.kernel " +
             directory +
             "; do mkdir -p .$part; mount --rbind $part .$part; done; exec env -u TSAN_OPTIONS chroot . " +
             ownProgram() + " --gtest_filter=None.*"});
    EXPECT_EQ(result.exitCode, OUTSIDE);
    EXPECT_THAT(result.error, StartsWith("refusing to run outside the sandbox"));
}

class RootTest : public SandboxTest {
 protected:
    static mode_t modeOf(const std::string& path) {
        struct stat status = {};
        EXPECT_EQ(stat(path.c_str(), &status), 0) << path;
        return status.st_mode & 07777U;
    }
};

TEST_F(RootTest, HasTheDirectoriesOfAFreshSystem) {
    for (const char* path : {"/usr", "/etc", "/var", "/var/log", "/run", "/root", "/home", "/proc", "/sys"}) {
        EXPECT_EQ(modeOf(path), 0755U) << path;
    }
    for (const char* path : {"/tmp", "/var/tmp", "/dev/shm"}) {
        EXPECT_EQ(modeOf(path), 01777U) << path;
    }
    EXPECT_FALSE(exists("/dev/log"));
    EXPECT_FALSE(exists("/usr/tern"));
    // The project itself may lie in /home or /root.
    EXPECT_EQ(run({"ls", "-A", "/run", "/sys/block", "/sys/class/ata_port"}).output,
              "/run:\n\n/sys/block:\n\n/sys/class/ata_port:\n");
}

TEST_F(RootTest, HasDevices) {
    EXPECT_EQ(run({"sh", "-c", "head -c 2 /dev/zero | od -An -tx1; echo lost > /dev/null"}).output,
              " 00 00\n");
    EXPECT_EQ(run({"sh", "-c", "head -c 9 /dev/urandom | wc -c; ! echo > /dev/full"}).output, "9\n");
    EXPECT_EQ(run({"sh", "-c", "echo text > /dev/stderr"}).error, "text\n");
    EXPECT_EQ(run({"script", "-qc", "tty", "/dev/null"}).output, "/dev/pts/0\r\n");
}

TEST_F(RootTest, ProcIsWritableAndSysrqTriggerIsAPlainFile) {
    EXPECT_EQ(readFile("/proc/sysrq-trigger"), "");
    struct stat status = {};
    ASSERT_EQ(lstat("/proc/sysrq-trigger", &status), 0);
    EXPECT_TRUE(S_ISREG(status.st_mode));
    writeFile("/proc/sysrq-trigger", "b");
    EXPECT_EQ(readFile("/proc/sysrq-trigger"), "b");
    EXPECT_FALSE(exists("/proc/drbd"));
    writeFile("/proc/drbd", "");
}

TEST_F(RootTest, MeminfoCanBeReplacedAndRemoved) {
    EXPECT_THAT(readFile("/proc/meminfo"), StartsWith("MemTotal:"));
    writeFile("/proc/meminfo", "MemTotal: 1 kB\n");
    EXPECT_EQ(run({"cat", "/proc/meminfo"}).output, "MemTotal: 1 kB\n");
    removeTree("/proc/meminfo");
    EXPECT_FALSE(exists("/proc/meminfo"));
    EXPECT_THAT(run({"/bin/ps", "-eo", "pid,ppid,stat,rss,cputime,args"}).output, HasSubstr("/bin/ps -eo"));
}

TEST_F(RootTest, ProgramsRunByTheLibraryWork) {
    const std::vector<std::pair<Words, const char*>> programs = {
        {{"/bin/ps", "-eo", "pid,ppid,stat,rss,cputime,args"},
         "^ +PID +PPID STAT +RSS +TIME COMMAND\n.*/bin/ps -eo"},
        {{"/bin/df"}, "^Filesystem .*\ntmpfs .* /tmp\n"},
        {{"/bin/ping", "-c", "1", "127.0.0.1"}, "1 packets transmitted, 1 received, 0% packet loss"},
        {{"/sbin/ifconfig", "-s"}, "^Iface .*\nlo [^\n]*\n$"}};
    for (const auto& [program, output] : programs) {
        const CommandResult result = run(program);
        EXPECT_EQ(result.exitCode, 0) << result.error;
        EXPECT_EQ(result.error, "");
        EXPECT_THAT(result.output, ContainsRegex(output));
    }
}

TEST_F(RootTest, LogsAndBuffersAreOnDifferentFileSystems) {
    writeFile("/tmp/ha/file", "");
    EXPECT_EQ(rename("/tmp/ha/file", "/var/log/ha/file"), -1);
    EXPECT_EQ(errno, EXDEV);
}

}  // namespace
}  // namespace test
