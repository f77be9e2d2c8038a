#include "launcher.h"

#include <signal.h>
#include <sys/wait.h>

#include "support/files.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "support/udp.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using ::testing::AllOf;
using ::testing::ContainsRegex;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;

namespace test {
namespace {

constexpr int kLeftovers = 97;
constexpr int kRefused = 98;
constexpr int kOutside = 99;

class LauncherTest : public SandboxTest {
 protected:
    static std::string processList() { return run({"ps", "-eo", "args"}).output; }

    // Runs a sandbox whose program waits until `change` has been made on the outside.
    static CommandResult runDuring(const std::function<void()>& change) {
        makeDirectories("/tmp/shared");
        Process sandbox(
            sandboxCommand("touch /tmp/shared/started; "
                           "until [ -e /tmp/shared/changed ]; do sleep 0.01; done",
                           {"--bind-rw", "/tmp/shared"}));
        EXPECT_TRUE(eventually(30s, [] { return exists("/tmp/shared/started"); })) << sandbox.error();
        change();
        writeFile("/tmp/shared/changed", "");
        return resultOf(std::move(sandbox));
    }
};

TEST_F(LauncherTest, PassesTheExitCodeOn) {
    EXPECT_EQ(runInSandbox("exit 0").exitCode, 0);
    EXPECT_EQ(runInSandbox("exit 7").exitCode, 7);
}

TEST_F(LauncherTest, ReportsASignalAsAShellDoes) {
    EXPECT_EQ(runInSandbox("kill -KILL $$").exitCode, 128 + SIGKILL);
    EXPECT_EQ(runInSandbox("kill -SEGV $$").exitCode, 128 + SIGSEGV);
}

TEST_F(LauncherTest, PassesOutputOn) {
    const CommandResult result = runInSandbox("echo out; echo err >&2");
    EXPECT_EQ(result.output, "out\n");
    EXPECT_EQ(result.error, "err\n");
}

TEST_F(LauncherTest, ReportsAProgramThatCannotBeStarted) {
    const CommandResult result = run({TERNHA_SANDBOX_PROGRAM, "--", "/no/such/program"});
    EXPECT_EQ(result.exitCode, 127);
    EXPECT_EQ(result.error, "ternha-sandbox: cannot start /no/such/program: No such file or directory\n");
}

TEST_F(LauncherTest, ExplainsItself) {
    const CommandResult result = run({TERNHA_SANDBOX_PROGRAM, "--help"});
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_THAT(result.output, StartsWith("Usage: ternha-sandbox "));
}

TEST_F(LauncherTest, RejectsWrongUse) {
    EXPECT_EQ(run({TERNHA_SANDBOX_PROGRAM}).exitCode, 2);
    EXPECT_EQ(run({TERNHA_SANDBOX_PROGRAM, "--no-such-option", "--", "true"}).exitCode, 2);
    EXPECT_EQ(run({TERNHA_SANDBOX_PROGRAM, "--bind", "relative", "--", "true"}).exitCode, 2);
    EXPECT_EQ(run({TERNHA_SANDBOX_PROGRAM, "--bind", "/", "--", "true"}).exitCode, 2);
}

TEST_F(LauncherTest, HidesTheFilesOfTheMachine) {
    writeFile("/tmp/secret", "");
    writeFile("/var/log/secret", "");
    writeFile("/run/secret", "");
    writeFile("/root/secret", "");
    const CommandResult result = runInSandbox("ls -A /tmp /var/log /run /root /home | grep secret");
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_EQ(result.output, "");
}

TEST_F(LauncherTest, HidesTheNetworkOfTheMachine) {
    ASSERT_EQ(run({"ip", "link", "add", "eth8", "type", "veth", "peer", "name", "eth9"}).exitCode, 0);
    ASSERT_EQ(run({"ip", "address", "add", "10.9.9.1/24", "dev", "eth8"}).exitCode, 0);
    const CommandResult interfaces = runInSandbox("ip -oneline link | wc -l; ip -oneline link");
    EXPECT_THAT(interfaces.output, AllOf(StartsWith("1\n"), HasSubstr(": lo:"), HasSubstr("UP")));
    EXPECT_NE(runInSandbox("ping -c 1 -W 1 10.9.9.1").exitCode, 0);
}

TEST_F(LauncherTest, HidesTheProcessesOfTheMachine) {
    const Process other({"sleep", "1234"});
    EXPECT_THAT(processList(), HasSubstr("sleep 1234"));
    EXPECT_THAT(runInSandbox("ps -eo args").output,
                AllOf(HasSubstr("ps -eo args"), Not(HasSubstr("sleep 1234"))));
}

TEST_F(LauncherTest, HasItsOwnHostName) {
    EXPECT_EQ(runInSandbox("hostname").output, "sandbox\n");
}

TEST_F(LauncherTest, KeepsTheMachinesProgramsReadOnly) {
    EXPECT_NE(runInSandbox("touch /usr/bin/new").exitCode, 0);
    EXPECT_EQ(runInSandbox("mkdir -p /usr/tern/etc && touch /usr/tern/etc/new").exitCode, 0);
    EXPECT_FALSE(exists("/usr/tern"));
}

TEST_F(LauncherTest, LetsTheTimeZoneBeReplaced) {
    EXPECT_EQ(runInSandbox("ln -sf /usr/share/zoneinfo/Asia/Tokyo /etc/localtime && date +%z").output,
              "+0900\n");
}

TEST_F(LauncherTest, BindsDirectoriesAtTheirPaths) {
    writeFile("/tmp/tree/file", "text");
    EXPECT_EQ(runInSandbox("cat /tmp/tree/file; touch /tmp/tree/new 2>&1", {"--bind", "/tmp/tree"}).output,
              "texttouch: cannot touch '/tmp/tree/new': Read-only file system\n");
    EXPECT_EQ(runInSandbox("touch /tmp/tree/new", {"--bind-rw", "/tmp/tree"}).exitCode, 0);
    EXPECT_TRUE(exists("/tmp/tree/new"));
}

TEST_F(LauncherTest, BindsAWritableDirectoryInsideAReadOnlyOne) {
    makeDirectories("/tmp/tree/build");
    EXPECT_EQ(runInSandbox("touch /tmp/tree/build/new && ! touch /tmp/tree/new",
                           {"--bind-rw", "/tmp/tree/build", "--bind", "/tmp/tree"})
                  .exitCode,
              0);
}

TEST_F(LauncherTest, KeepsTheWorkingDirectory) {
    makeDirectories("/tmp/tree");
    const std::string launcher = TERNHA_SANDBOX_PROGRAM;
    EXPECT_EQ(run({"sh", "-c", "cd /tmp/tree && " + launcher + " --bind /tmp/tree -- pwd"}).output,
              "/tmp/tree\n");
    EXPECT_EQ(run({"sh", "-c", "cd /tmp/tree && " + launcher + " -- pwd"}).output, "/\n");
}

TEST_F(LauncherTest, HandsInACleanEnvironment) {
    const CommandResult result =
        run({"env", "-i", "SECRET=1", "GTEST_COLOR=no", "GCOV_PREFIX=/x", "UBSAN_OPTIONS=print_stacktrace=1",
             TERNHA_SANDBOX_PROGRAM, "--env", "EXTRA=2", "--env", "HOME=/home", "--", "/usr/bin/env"});
    EXPECT_THAT(lines(result.output), ::testing::UnorderedElementsAre(
                                          "PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin",
                                          "HOME=/home", "LANG=C.UTF-8", "TERM=dumb", "GTEST_COLOR=no",
                                          "GCOV_PREFIX=/x", "UBSAN_OPTIONS=print_stacktrace=1", "EXTRA=2"));
    EXPECT_EQ(runInSandbox("echo $HOME").output, "/root\n");
}

TEST_F(LauncherTest, ClosesInheritedDescriptors) {
    const CommandResult result = run({"sh", "-c",
                                      "exec 3</dev/null 9</dev/null; exec " +
                                          std::string(TERNHA_SANDBOX_PROGRAM) + " -- ls /proc/self/fd"});
    EXPECT_EQ(result.output, "0\n1\n2\n3\n") << "3 is the directory that is listed";
}

TEST_F(LauncherTest, SwitchesAddressRandomizationOff) {
    constexpr const char* kFixedAddresses = "00040000\n";
    EXPECT_EQ(runInSandbox("cat /proc/self/personality", {"--no-aslr"}).output, kFixedAddresses);
}

TEST_F(LauncherTest, ForwardsSignals) {
    for (const int signal : {SIGTERM, SIGINT}) {
        Process sandbox(sandboxCommand(
            "trap 'exit 3' TERM; trap 'exit 4' INT; echo ready; while :; do sleep 0.01; done"));
        ASSERT_TRUE(eventually(30s, [&] { return sandbox.output() == "ready\n"; }));
        sandbox.signal(signal);
        EXPECT_EQ(resultOf(std::move(sandbox)).exitCode, signal == SIGTERM ? 3 : 4);
    }
}

TEST_F(LauncherTest, NothingSurvivesTheLauncher) {
    Process sandbox(sandboxCommand("echo ready; sleep 1234"));
    ASSERT_TRUE(eventually(30s, [&] { return sandbox.output() == "ready\n"; }));
    EXPECT_THAT(processList(), HasSubstr("sleep 1234"));
    sandbox.signal(SIGKILL);
    EXPECT_EQ(sandbox.wait(), SIGKILL);
    EXPECT_TRUE(eventually(30s, [] { return processList().find("sleep 1234") == std::string::npos; }));
}

TEST_F(LauncherTest, ReportsAProcessLeftBehind) {
    const Stopwatch stopwatch;
    const CommandResult result = runInSandbox("setsid sleep 1234 & exit 0");
    EXPECT_EQ(result.exitCode, kLeftovers);
    EXPECT_THAT(result.error,
                ContainsRegex("^ternha-sandbox: left behind: process [0-9]+ \\(sleep 1234\\)\n$"));
    EXPECT_GE(stopwatch.elapsed(), 2s);
    EXPECT_THAT(processList(), Not(HasSubstr("sleep 1234")));
}

TEST_F(LauncherTest, WaitsForAProcessThatIsAboutToEnd) {
    const CommandResult result = runInSandbox("sleep 0.3 & exit 5");
    EXPECT_EQ(result.exitCode, 5);
    EXPECT_EQ(result.error, "");
}

TEST_F(LauncherTest, ReportsAChangedFileOfTheMachine) {
    const CommandResult result = runDuring([] { writeFile("/tmp/ha/x", "text"); });
    EXPECT_EQ(result.exitCode, kLeftovers);
    EXPECT_THAT(result.error,
                HasSubstr("ternha-sandbox: changed outside: + /tmp/ha/x (mode 100644, 4 bytes"));
}

TEST_F(LauncherTest, ReportsARemovedFileOfTheMachine) {
    writeFile("/usr/tern/etc/ha.conf", "text");
    const CommandResult result = runDuring([] { removeTree("/usr/tern"); });
    EXPECT_EQ(result.exitCode, kLeftovers);
    EXPECT_THAT(result.error,
                HasSubstr("ternha-sandbox: changed outside: - /usr/tern/etc/ha.conf (mode 100644, 4 bytes"));
}

TEST_F(LauncherTest, ReportsAPeerSocketOfTheMachine) {
    std::optional<UdpSocket> socket;
    const CommandResult result = runDuring([&] { socket.emplace("127.0.0.1", 7499); });
    EXPECT_EQ(result.exitCode, kLeftovers);
    EXPECT_THAT(result.error,
                ContainsRegex("changed outside: \\+ UDP socket 0100007F:1D4B \\(inode [0-9]+\\)\n$"));
}

TEST_F(LauncherTest, ReportsAControlSocketOfTheMachine) {
    makeDirectories("/tmp/ternha");
    std::optional<SystemLog> socket;
    const CommandResult result = runDuring([&] { socket.emplace("/tmp/ternha/control.sock"); });
    EXPECT_EQ(result.exitCode, kLeftovers);
    EXPECT_EQ(result.error, "ternha-sandbox: changed outside: + Unix socket /tmp/ternha/control.sock\n");
}

TEST_F(LauncherTest, AcceptsAChangeElsewhere) {
    const CommandResult result = runDuring([] { writeFile("/tmp/other", "text"); });
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_EQ(result.error, "");
}

// The limits count in a user namespace of their own, so that nobody else meets them.
TEST_F(LauncherTest, RefusesWithoutNamespaces) {
    for (const char* limit : {"max_mnt_namespaces", "max_net_namespaces"}) {
        const CommandResult result =
            run({"unshare", "--user", "--map-root-user", "sh", "-c",
                 std::string("echo 0 > /.kernel/proc/sys/user/") + limit + " && exec " +
                     TERNHA_SANDBOX_PROGRAM + " -- touch /tmp/escaped"});
        EXPECT_EQ(result.exitCode, kRefused) << limit;
        EXPECT_EQ(
            result.error,
            "ternha-sandbox: refusing to run touch: cannot make mount, net, pid, ipc and uts namespaces: "
            "No space left on device\n");
        EXPECT_FALSE(exists("/tmp/escaped"));
    }
}

TEST_F(LauncherTest, RefusesWithoutAMount) {
    const CommandResult result =
        run({TERNHA_SANDBOX_PROGRAM, "--bind", "/no/such/directory", "--", "touch", "/tmp/escaped"});
    EXPECT_EQ(result.exitCode, kRefused);
    EXPECT_EQ(
        result.error,
        "ternha-sandbox: refusing to run touch: cannot bind /no/such/directory: No such file or directory\n");
    EXPECT_FALSE(exists("/tmp/escaped"));
}

TEST_F(LauncherTest, TestProgramRefusesWithoutTheMarker) {
    const CommandResult result =
        run({"sh", "-c", "rm /.ternha-sandbox; exec " + ownProgram() + " --gtest_filter=None.*"});
    EXPECT_EQ(result.exitCode, kOutside);
    EXPECT_EQ(result.output.find("Running"), std::string::npos);
    EXPECT_THAT(result.error, StartsWith("refusing to run outside the sandbox"));
}

TEST_F(LauncherTest, TestProgramRefusesOtherMountsThanInits) {
    EXPECT_EQ(run({ownProgram(), "--gtest_filter=None.*"}).exitCode, 0);
    EXPECT_EQ(run({"unshare", "--mount", ownProgram(), "--gtest_filter=None.*"}).exitCode, kOutside);
}

TEST_F(LauncherTest, TestProgramRefusesARootThatIsNoTmpfs) {
    makeDirectories("/tmp/root");
    const std::string directory = std::filesystem::path(ownProgram()).parent_path();
    const CommandResult result = run(
        {"sh", "-ec",
         "mount -t ramfs ramfs /tmp/root; cd /tmp/root; touch .ternha-sandbox; cp -P /bin /lib* .; "
         "for part in /usr /proc /.kernel " +
             directory +
             "; do mkdir -p .$part; mount --rbind $part .$part; done; exec env -u TSAN_OPTIONS chroot . " +
             ownProgram() + " --gtest_filter=None.*"});
    EXPECT_EQ(result.exitCode, kOutside);
    EXPECT_THAT(result.error, StartsWith("refusing to run outside the sandbox"));
}

}  // namespace
}  // namespace test
