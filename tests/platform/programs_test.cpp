#include <pthread.h>
#include <sys/stat.h>

#include <array>
#include <atomic>
#include <csignal>
#include <functional>
#include <thread>

#include "platform_test.h"
#include "support/descriptor.h"

namespace platform_test {
namespace {

using ::testing::MatchesRegex;

class ProgramsTest : public test::SandboxTest {};

TEST_F(ProgramsTest, ExecReturnsZeroOnSuccess) {
    EXPECT_EQ(PLATExec("/bin/sh", "-c", "exit 0", nullptr), 0);
    const Arguments arguments = {"/bin/sh", "-c", "exit 0"};
    EXPECT_EQ(PLATExecv(arguments.path(), arguments.vector(), 1), 0);
}

TEST_F(ProgramsTest, ExecReturnsNonZeroOnFailure) {
    EXPECT_NE(PLATExec("/bin/sh", "-c", "exit 1", nullptr), 0);
    EXPECT_NE(PLATExec("/bin/sh", "-c", "exit 255", nullptr), 0);
    const Arguments arguments = {"/bin/sh", "-c", "exit 1"};
    EXPECT_NE(PLATExecv(arguments.path(), arguments.vector(), 1), 0);
}

TEST_F(ProgramsTest, ExecReturnsNonZeroOnSignal) {
    EXPECT_NE(PLATExec("/bin/sh", "-c", "kill -KILL $$", nullptr), 0);
    const Arguments arguments = {"/bin/sh", "-c", "kill -KILL $$"};
    EXPECT_NE(PLATExecv(arguments.path(), arguments.vector(), 1), 0);
}

TEST_F(ProgramsTest, ExecWaitsForTheProgram) {
    constexpr char SLOW[] = "sleep 0.3; echo done > /tmp/done";
    EXPECT_EQ(PLATExec("/bin/sh", "-c", SLOW, nullptr), 0);
    EXPECT_TRUE(test::exists("/tmp/done"));

    test::removeTree("/tmp/done");
    const Arguments arguments = {"/bin/sh", "-c", SLOW};
    EXPECT_EQ(PLATExecv(arguments.path(), arguments.vector(), 1), 0);
    EXPECT_TRUE(test::exists("/tmp/done"));
    EXPECT_TRUE(hasNoChild());
}

TEST_F(ProgramsTest, ExecPassesThePathAndTheListedArguments) {
    EXPECT_EQ(PLATExec("/bin/sh", "-c", "tr '\\0' '|' < /proc/$$/cmdline > /tmp/arguments", "a b", "",
                       "$HOME", nullptr),
              0);
    EXPECT_EQ(test::readFile("/tmp/arguments"),
              "/bin/sh|-c|tr '\\0' '|' < /proc/$$/cmdline > /tmp/arguments|a b||$HOME|");
}

TEST_F(ProgramsTest, ExecvPassesItsArgumentVector) {
    const Arguments arguments = {"name", "-c", "printf '%s|' \"$0\" \"$@\" > /tmp/arguments", "zero", "a b",
                                 "",     "*"};
    EXPECT_EQ(PLATExecv("/bin/sh", arguments.vector(), 1), 0);
    EXPECT_EQ(test::readFile("/tmp/arguments"), "zero|a b||*|");
}

TEST_F(ProgramsTest, ExecReturnsNonZeroWhenTheProgramCannotStart) {
    test::writeFile("/tmp/text", "#!/bin/sh\n");
    for (const char* const path :
         {"/bin/no-such-program", "/tmp", "/tmp/text", "", static_cast<const char*>(nullptr)}) {
        SCOPED_TRACE(path == nullptr ? "null" : path);
        const char* const argv[] = {"program", nullptr};
        EXPECT_NE(PLATExec(path, nullptr), 0);
        EXPECT_NE(PLATExecv(path, argv, 1), 0);
        EXPECT_NE(PLATExecv(path, argv, 0), 0);
    }
    const char* const empty[] = {nullptr};
    EXPECT_NE(PLATExecv("/bin/true", empty, 1), 0);
    EXPECT_NE(PLATExecv("/bin/true", nullptr, 1), 0);
    EXPECT_NE(PLATExecv("/bin/true", nullptr, 0), 0);
    EXPECT_TRUE(hasNoChild());
}

TEST_F(ProgramsTest, ExecvWithoutWaitLeavesNoChild) {
    const Gate gate;
    const Arguments arguments = {"/bin/sh", "-c", std::string(Gate::PASS) + "; echo done > /tmp/done"};
    EXPECT_EQ(PLATExecv(arguments.path(), arguments.vector(), 0), 0);
    EXPECT_TRUE(hasNoChild());
    EXPECT_FALSE(test::exists("/tmp/done"));
    EXPECT_TRUE(gate.open());
    EXPECT_TRUE(test::eventually(PATIENCE, [] { return test::exists("/tmp/done"); }));
    EXPECT_TRUE(hasNoChild());
}

TEST_F(ProgramsTest, ExecvWithoutWaitIgnoresTheExitStatus) {
    const Arguments arguments = {"/bin/false"};
    EXPECT_EQ(PLATExecv(arguments.path(), arguments.vector(), 0), 0);
}

TEST_F(ProgramsTest, InheritOnlyTheStandardDescriptors) {
    // Not close-on-exec, like files of other code in a host daemon.
    const test::Descriptor file(open("/dev/null", O_RDONLY), "cannot open /dev/null");
    const test::Descriptor high(fcntl(file.get(), F_DUPFD, 100), "cannot copy a descriptor");
    const Arguments cat = {"/bin/cat"};
    FILE* const stream = PLATPopenv(cat.path(), "w", cat.vector());
    ASSERT_NE(stream, nullptr);

    // The last one belongs to the listing itself.
    constexpr char STANDARD_ONLY[] = "0\n1\n2\n3\n";
    EXPECT_EQ(outputOf({"/bin/ls", "/proc/self/fd"}).text, STANDARD_ONLY);
    EXPECT_EQ(PLATExec("/bin/sh", "-c", "exec ls /proc/self/fd > /tmp/waited", nullptr), 0);
    EXPECT_EQ(test::readFile("/tmp/waited"), STANDARD_ONLY);
    const Arguments detached = {"/bin/sh", "-c", "ls /proc/self/fd > /tmp/new; mv /tmp/new /tmp/detached"};
    EXPECT_EQ(PLATExecv(detached.path(), detached.vector(), 0), 0);
    EXPECT_TRUE(test::eventually(PATIENCE, [] { return test::exists("/tmp/detached"); }));
    EXPECT_EQ(test::readFile("/tmp/detached"), STANDARD_ONLY);

    EXPECT_EQ(PLATPclose(stream), 0);
}

TEST_F(ProgramsTest, InheritNeitherBlockedNorIgnoredSignals) {
    sigset_t all;
    sigfillset(&all);
    ASSERT_EQ(pthread_sigmask(SIG_SETMASK, &all, nullptr), 0);
    for (const int number : {SIGPIPE, SIGHUP, SIGINT, SIGTERM, SIGUSR1}) {
        ASSERT_NE(std::signal(number, SIG_IGN), SIG_ERR);
    }

    // posix_spawn leaves signals above the 31 standard ones, which the C library uses itself,
    // ignored.
    const auto hasNoSignal = MatchesRegex("SigBlk:\t0{16}\nSigIgn:\t[0-9a-f]{8}[08]0{7}\n");
    EXPECT_THAT(outputOf({"/bin/grep", "-E", "^Sig(Blk|Ign)", "/proc/self/status"}).text, hasNoSignal);
    EXPECT_EQ(
        PLATExec("/bin/sh", "-c", "exec grep -E '^Sig(Blk|Ign)' /proc/self/status > /tmp/waited", nullptr),
        0);
    EXPECT_THAT(test::readFile("/tmp/waited"), hasNoSignal);
    const Arguments detached = {
        "/bin/sh", "-c", "grep -E '^Sig(Blk|Ign)' /proc/self/status > /tmp/new; mv /tmp/new /tmp/detached"};
    EXPECT_EQ(PLATExecv(detached.path(), detached.vector(), 0), 0);
    EXPECT_TRUE(test::eventually(PATIENCE, [] { return test::exists("/tmp/detached"); }));
    EXPECT_THAT(test::readFile("/tmp/detached"), hasNoSignal);
}

TEST_F(ProgramsTest, ExecvKeepsTheCallersSignalMask) {
    sigset_t blocked;
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGUSR2);
    ASSERT_EQ(pthread_sigmask(SIG_SETMASK, &blocked, nullptr), 0);
    const Arguments arguments = {"/bin/true"};
    for (const int wait : {0, 1}) {
        EXPECT_EQ(PLATExecv(arguments.path(), arguments.vector(), wait), 0);
        sigset_t now;
        ASSERT_EQ(pthread_sigmask(SIG_SETMASK, nullptr, &now), 0);
        for (const int number : {SIGUSR1, SIGUSR2, SIGTERM, SIGCHLD, SIGPIPE}) {
            EXPECT_EQ(sigismember(&now, number), number == SIGUSR2 ? 1 : 0)
                << "wait " << wait << " signal " << number;
        }
    }
}

int handledPipe = -1;
pid_t hostProcess = -1;

void tellStrangers(int /*signal*/) {
    if (getpid() != hostProcess) {
        [[maybe_unused]] const ssize_t written = write(handledPipe, "!", 1);
    }
}

TEST_F(ProgramsTest, ExecvWithoutWaitRunsNoSignalHandlerInTheChild) {
    int ends[2] = {-1, -1};
    ASSERT_EQ(pipe2(ends, O_CLOEXEC | O_NONBLOCK), 0);
    const test::Descriptor readEnd(ends[0], "pipe");
    const test::Descriptor writeEnd(ends[1], "pipe");
    handledPipe = writeEnd.get();
    hostProcess = getpid();
    ASSERT_NE(std::signal(SIGCHLD, tellStrangers), SIG_ERR);

    const Arguments arguments = {"/bin/true"};
    for (int i = 0; i < 200; ++i) {
        ASSERT_EQ(PLATExecv(arguments.path(), arguments.vector(), 0), 0);
    }
    char byte = 0;
    EXPECT_EQ(read(readEnd.get(), &byte, 1), -1);
    EXPECT_EQ(errno, EAGAIN);
    ASSERT_NE(std::signal(SIGCHLD, SIG_DFL), SIG_ERR);
}

std::atomic<int> interruptions{0};

void countInterruption(int /*signal*/) {
    ++interruptions;
}

bool isAsleep(pid_t thread) {
    const std::string stat = test::readFile("/proc/self/task/" + std::to_string(thread) + "/stat");
    return stat.substr(stat.rfind(')') + 2, 1) == "S";
}

// Signals arrive during the wait for a program.
class InterruptedWaitTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        SandboxTest::SetUp();
        struct sigaction action = {};
        action.sa_handler = countInterruption;  // without SA_RESTART
        ASSERT_EQ(sigaction(SIGUSR1, &action, nullptr), 0);
    }

    // Interrupt the thread that runs `waitForProgram`, then let the program end; return the call's
    // result.
    int interrupted(const std::function<int()>& waitForProgram) const {
        std::atomic<pid_t> id{0};
        int result = -1;
        std::thread thread([&] {
            id = gettid();
            result = waitForProgram();
        });
        for (int i = 1; i <= 3; ++i) {
            EXPECT_TRUE(test::eventually(
                PATIENCE, [&] { return id != 0 && test::exists("/tmp/started") && isAsleep(id); }));
            EXPECT_EQ(pthread_kill(thread.native_handle(), SIGUSR1), 0);
            EXPECT_TRUE(test::eventually(PATIENCE, [&] { return interruptions == i; }));
        }
        EXPECT_TRUE(_gate.open());
        thread.join();
        EXPECT_TRUE(hasNoChild());
        return result;
    }

    static std::string programWithExit(int code) {
        return "echo > /tmp/started; " + std::string(Gate::PASS) + "; exit " + std::to_string(code);
    }

 private:
    const Gate _gate;
};

TEST_F(InterruptedWaitTest, ExecKeepsWaiting) {
    EXPECT_EQ(interrupted([] { return PLATExec("/bin/sh", "-c", programWithExit(0).c_str(), nullptr); }), 0);
}

TEST_F(InterruptedWaitTest, ExecvKeepsWaiting) {
    const Arguments arguments = {"/bin/sh", "-c", programWithExit(0)};
    EXPECT_EQ(interrupted([&] { return PLATExecv(arguments.path(), arguments.vector(), 1); }), 0);
}

TEST_F(InterruptedWaitTest, PcloseKeepsWaiting) {
    const Arguments arguments = {"/bin/sh", "-c", programWithExit(3)};
    FILE* const stream = PLATPopenv(arguments.path(), "r", arguments.vector());
    ASSERT_NE(stream, nullptr);
    EXPECT_EQ(interrupted([&] { return PLATPclose(stream); }), 3 << 8);
}

}  // namespace
}  // namespace platform_test
