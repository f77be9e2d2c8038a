#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <sched.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <sstream>
#include <thread>

#include "support/descriptor.h"
#include "support/udp.h"
#include "ternhad/daemon.h"

namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;
using ::testing::Not;

constexpr char BUFFER[] = "/tmp/ha/ha.daemon.log";
constexpr char LOG[] = "/var/log/ha/ha.daemon.log";
constexpr char TRIGGER[] = "/proc/sysrq-trigger";

// A peer at 127.0.0.2 that replies to everything for as long as it lives.
class Peer {
 public:
    Peer() : _thread([this] { run(); }) {}
    ~Peer() {
        _isOver = true;
        _thread.join();
    }

    Peer(const Peer&) = delete;
    Peer& operator=(const Peer&) = delete;

 private:
    void run() {
        test::UdpSocket socket("127.0.0.2", 7499);
        while (!_isOver) {
            if (const auto request = socket.receive(10ms)) {
                const std::string reply = request->bytes == "is_alive" ? "alive"
                                          : request->bytes == "is_disk_err_handling"
                                              ? R"({"errHandlingDisk":[],"isDiskErrHandling":false})"
                                              : "not_resync";
                socket.send(reply, request->address, request->port);
            }
        }
    }

    std::atomic<bool> _isOver{false};
    std::thread _thread;
};

// Makes every open of this file for writing hang, as on a disk that hangs. Until release().
void hang(const char* file) {
    test::removeTree(file);
    ASSERT_EQ(mkfifo(file, 0600), 0);
}

// A daemon on 127.0.0.1, on a machine that gets sick while its peer at 127.0.0.2 is well.
class SickMachineTest : public ::testing::Test {
 protected:
    void SetUp() override {
        test::writeFile(TRIGGER, "");
        test::makeDirectories("/var/log/ha");
    }

    void start(const std::vector<std::string>& more = {}) {
        startAlone(more);
        ASSERT_TRUE(test::eventually(20s, [] { return isPeerAlive(); })) << daemon->error();
    }

    // Without waiting for the peer to be seen.
    void startAlone(const std::vector<std::string>& more = {}) {
        std::vector<std::string> command = {"/usr/bin/env", std::string("LD_PRELOAD=") + SICK_MACHINE};
        const auto arguments = test::daemonArguments("127.0.0.1", "127.0.0.2", "lo", more);
        command.insert(command.end(), arguments.begin(), arguments.end());
        daemon.emplace(command);
    }

    static bool isPeerAlive() { return test::statusAt()["isRemoteAlive"].asBool(); }

    // What the journal shows.
    bool says(const std::string& text) const { return daemon->error().find(text) != std::string::npos; }

    // The daemon's replies to a request from another address of this machine.
    static bool replies(const std::string& request) {
        test::UdpSocket asker("127.0.0.4");
        asker.send(request, "127.0.0.1", 7499);
        return asker.receive(2s).has_value();
    }

    static void orderReboot() { test::UdpSocket("127.0.0.4").send("reboot_remote", "127.0.0.1", 7499); }

    static bool isRebooted() { return test::readFile(TRIGGER) == "b"; }

    // The limit is generous, for emulated processors: what hangs here would hang for a minute.
    void expectEndInTime(std::chrono::milliseconds limit = 5s) {
        const test::Stopwatch stopwatch;
        daemon->signal(SIGTERM);
        const auto status = daemon->waitFor(20s);
        ASSERT_TRUE(status.has_value());
        EXPECT_EQ(*status, 0);
        EXPECT_LT(stopwatch.elapsed(), limit);
    }

    std::optional<Peer> peer{std::in_place};
    std::optional<test::Process> daemon;
};

TEST_F(SickMachineTest, LackOfDescriptorsIsNeitherThePeersDeathNorItsDiskErrors) {
    start();
    // Any new descriptor takes the lowest free number.
    rlim_t free = 0;
    const std::string descriptors = "/proc/" + std::to_string(daemon->pid()) + "/fd/";
    while (std::filesystem::is_symlink(descriptors + std::to_string(free))) {
        ++free;
    }
    rlimit usual = {};
    ASSERT_EQ(prlimit(daemon->pid(), RLIMIT_NOFILE, nullptr, &usual), 0);
    const rlimit none = {free, usual.rlim_max};
    ASSERT_EQ(prlimit(daemon->pid(), RLIMIT_NOFILE, &none, nullptr), 0);
    EXPECT_FALSE(test::eventually(6s, [] {
        const std::string log = test::wholeLog();
        return log.find("changed to dead") != std::string::npos;
    }));
    ASSERT_EQ(prlimit(daemon->pid(), RLIMIT_NOFILE, &usual, nullptr), 0);
    EXPECT_TRUE(test::eventually(20s, [] { return isPeerAlive(); }));
    // Disk errors of the peer would have been recorded.
    EXPECT_THAT(test::wholeLog("", "ha.daemon.record"), Not(HasSubstr("\"isRemoteDiskErrHandling\":true")));
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("changed to dead")));
    expectEndInTime();
}

TEST_F(SickMachineTest, ProbesThatCannotLeaveAreLoggedOnceAndAreNotThePeersDeath) {
    start({"--dead-after", "0.6"});
    test::writeFile("/tmp/no-buffers", "");
    EXPECT_TRUE(test::eventually(20s, [] {
        return test::wholeLog().find("Cannot send liveness probes: No buffer space available\n") !=
               std::string::npos;
    }));
    EXPECT_FALSE(test::eventually(3s, [] { return !isPeerAlive(); }));
    test::removeTree("/tmp/no-buffers");
    EXPECT_TRUE(test::eventually(
        20s, [] { return test::wholeLog().find("Can again send liveness probes\n") != std::string::npos; }));
    const std::string log = test::wholeLog();
    EXPECT_EQ(log.find("Cannot send"), log.rfind("Cannot send"));
    EXPECT_THAT(log, Not(HasSubstr("changed to dead")));
    peer.reset();
    EXPECT_TRUE(test::eventually(20s, [] { return !isPeerAlive(); }));
    expectEndInTime();
}

TEST_F(SickMachineTest, ProbesThatCannotLeaveFromTheStartAreNotThePeersDeath) {
    test::writeFile("/tmp/no-buffers", "");
    startAlone({"--dead-after", "0.6"});
    EXPECT_FALSE(test::eventually(3s, [this] { return says("peer-dead"); }));
    test::removeTree("/tmp/no-buffers");
    EXPECT_TRUE(test::eventually(20s, [this] { return says("peer-alive (was unknown)"); }));
    expectEndInTime();
}

TEST_F(SickMachineTest, AFifoForTheHostNameHangsNobody) {
    ASSERT_EQ(mkfifo("/tmp/.ha.hostname.original", 0600), 0);
    start();
    EXPECT_TRUE(replies("remote_hostname"));
    EXPECT_TRUE(replies("is_alive"));
    expectEndInTime();
}

TEST_F(SickMachineTest, AHangingBufferDelaysNoChangeOfState) {
    start();
    hang(BUFFER);
    peer.reset();
    EXPECT_TRUE(test::eventually(6s, [] { return !isPeerAlive(); }));
    peer.emplace();
    EXPECT_TRUE(test::eventually(6s, [] { return isPeerAlive(); }));
    EXPECT_TRUE(replies("is_alive"));
    expectEndInTime();
}

TEST_F(SickMachineTest, AHangingBufferHindersNoReboot) {
    start();
    hang(BUFFER);
    orderReboot();
    EXPECT_TRUE(test::eventually(20s, isRebooted));
}

TEST_F(SickMachineTest, AHangingLogDiskHindersNoReboot) {
    start();
    hang(LOG);
    orderReboot();
    EXPECT_TRUE(test::eventually(20s, isRebooted));
    EXPECT_TRUE(replies("is_alive"));
}

TEST_F(SickMachineTest, AHangingSyncHindersNoReboot) {
    start();
    test::writeFile("/tmp/hanging-sync", "");
    orderReboot();
    EXPECT_TRUE(test::eventually(20s, isRebooted));
}

TEST_F(SickMachineTest, ARebootThatIsNotHinderedDoesNotWait) {
    start();
    const test::Stopwatch stopwatch;
    orderReboot();
    EXPECT_TRUE(test::eventually(4s, isRebooted)) << "the deadline is for what hangs";
}

TEST_F(SickMachineTest, AnOrderThatTheKernelDoesNotTakeIsAnswered) {
    test::removeTree(TRIGGER);
    test::makeDirectories(TRIGGER);
    start();
    EXPECT_TRUE(replies("reboot_remote"));
    EXPECT_TRUE(test::eventually(10s, [] {
        return test::wholeLog().find("Cannot reboot at the peer's order: Is a directory") !=
               std::string::npos;
    }));
    expectEndInTime();
}

// Seconds of processor time that a process has used.
double processorTime(pid_t process) {
    std::istringstream stat(test::readFile("/proc/" + std::to_string(process) + "/stat"));
    stat.ignore(4096, ')');
    std::string field;
    for (int i = 3; i <= 13; ++i) {
        stat >> field;
    }
    double user = 0;
    double kernel = 0;
    stat >> user >> kernel;
    return (user + kernel) / static_cast<double>(sysconf(_SC_CLK_TCK));
}

TEST_F(SickMachineTest, AFlushThatEndsAfterItsOrderCostsNoProcessor) {
    test::removeTree(TRIGGER);
    test::makeDirectories(TRIGGER);
    start();
    test::writeFile("/tmp/hanging-sync", "");
    orderReboot();
    ASSERT_TRUE(test::eventually(20s, [] {
        return test::wholeLog().find("Cannot reboot at the peer's order: Is a directory") !=
               std::string::npos;
    }));
    test::removeTree("/tmp/hanging-sync");
    const double before = processorTime(daemon->pid());
    std::this_thread::sleep_for(3s);  // what is measured
    EXPECT_LT(processorTime(daemon->pid()) - before, 1.5);
    expectEndInTime();
}

TEST_F(SickMachineTest, FrozenDisksDoNotHinderARestart) {
    start();
    expectEndInTime();
    test::writeFile("/tmp/frozen-disks", "");
    start();
    expectEndInTime();
}

TEST_F(SickMachineTest, AHangingLogDiskDelaysNeitherTheEndNorARestart) {
    start({"--log-interval", "0.1"});
    hang(LOG);
    EXPECT_FALSE(test::eventually(1s, [] { return !isPeerAlive(); }));
    expectEndInTime();
    start();
    EXPECT_TRUE(replies("is_alive"));
    expectEndInTime();
}

TEST_F(SickMachineTest, ACompressionThatHangsDoesNotDelayTheEndAndLosesNoLine) {
    test::replaceProgram("/bin/xz", ": > /tmp/compressing; exec sleep 60");
    start();
    daemon->signal(SIGHUP);
    ASSERT_TRUE(test::eventually(20s, [] { return test::exists("/tmp/compressing"); }));
    expectEndInTime();
    EXPECT_THAT(test::readFile(LOG), HasSubstr("Stopping"));
    EXPECT_NE(test::run({"pgrep", "sleep"}).exitCode, 0);
}

pid_t childOf(pid_t process) {
    const auto result = test::run({"pgrep", "-P", std::to_string(process), "ternhad"});
    return result.exitCode == 0 ? std::stoi(result.output) : -1;
}

TEST_F(SickMachineTest, TheLogKeeperIsStartedAgainWhenItDies) {
    start({"--log-interval", "3600"});
    const pid_t keeper = childOf(daemon->pid());
    ASSERT_GT(keeper, 0);
    kill(keeper, SIGKILL);
    ASSERT_TRUE(test::eventually(20s, [&] {
        const pid_t next = childOf(daemon->pid());
        return next > 0 && next != keeper;
    }));
    daemon->signal(SIGHUP);
    EXPECT_TRUE(test::eventually(20s, [] { return test::exists("/var/log/ha/ha.daemon.log.0.xz"); }));
    EXPECT_THAT(test::wholeLog() + test::run({"xz", "-dc", "/var/log/ha/ha.daemon.log.0.xz"}).output,
                HasSubstr("The log keeper has died, another is started"));
    expectEndInTime();
}

// Holds a process as a hanging disk would: when it is killed, it is not gone until the object is.
class Undying {
 public:
    explicit Undying(pid_t process) : _process(process) {
        EXPECT_EQ(ptrace(PTRACE_SEIZE, process, nullptr, nullptr), 0);
    }
    ~Undying() { waitpid(_process, nullptr, __WALL); }

    Undying(const Undying&) = delete;
    Undying& operator=(const Undying&) = delete;

 private:
    pid_t _process;
};

TEST_F(SickMachineTest, ALogKeeperThatHangsIsReplacedAndLeftBehind) {
    test::replaceProgram("/bin/xz", ": > /tmp/compressing; exec sleep 600");
    start({"--log-interval", "3600", "--dead-after", "0.6"});
    const pid_t keeper = childOf(daemon->pid());
    ASSERT_GT(keeper, 0);
    daemon->signal(SIGHUP);
    ASSERT_TRUE(test::eventually(20s, [] { return test::exists("/tmp/compressing"); }));
    const Undying undying(keeper);
    test::restoreProgram("/bin/xz");
    test::writeFile("/tmp/an-hour-later", "");
    EXPECT_TRUE(test::eventually(20s, [&] {
        daemon->signal(SIGHUP);
        return test::wholeLog().find("The log keeper hangs, another takes its place") != std::string::npos;
    }));
    EXPECT_TRUE(test::eventually(20s, [] { return test::exists("/var/log/ha/ha.daemon.log.0.xz"); }));
    EXPECT_EQ(kill(keeper, 0), 0) << "it is not left behind, but gone";
    EXPECT_TRUE(isPeerAlive());
    EXPECT_FALSE(says("peer-dead"));
    test::removeTree("/tmp/an-hour-later");
    expectEndInTime();
    EXPECT_EQ(kill(keeper, 0), 0);
}

TEST_F(SickMachineTest, TheLogKeeperDiesWithTheDaemon) {
    start();
    const pid_t keeper = childOf(daemon->pid());
    ASSERT_GT(keeper, 0);
    daemon->signal(SIGKILL);
    EXPECT_TRUE(test::eventually(10s, [&] { return kill(keeper, 0) != 0; }));
}

TEST_F(SickMachineTest, TheLogKeeperHoldsNoSocket) {
    start();
    const pid_t keeper = childOf(daemon->pid());
    for (const auto& entry : std::filesystem::directory_iterator("/proc/" + std::to_string(keeper) + "/fd")) {
        std::error_code gone;
        EXPECT_THAT(std::filesystem::read_symlink(entry.path(), gone).string(), Not(HasSubstr("socket:")));
    }
    expectEndInTime();
}

// The real-time priority of a process's thread; 0 for an ordinary one.
int priorityOf(pid_t process, const std::string& thread) {
    for (const auto& task :
         std::filesystem::directory_iterator("/proc/" + std::to_string(process) + "/task")) {
        if (test::readFile(task.path() / "comm") == thread + '\n') {
            sched_param parameters = {};
            sched_getparam(std::stoi(task.path().filename()), &parameters);
            return parameters.sched_priority;
        }
    }
    ADD_FAILURE() << "no thread " << thread;
    return -1;
}

// Nobody but root may usually have a real-time priority.
bool isPriorityPermitted(int priority) {
    bool isPermitted = false;
    std::thread([&] {
        sched_param parameters = {};
        parameters.sched_priority = priority;
        isPermitted = pthread_setschedparam(pthread_self(), SCHED_RR, &parameters) == 0;
    }).join();
    return isPermitted;
}

TEST_F(SickMachineTest, ProbesComeBeforeRepliesAndRepliesBeforeAllElse) {
    start();
    const int highest = sched_get_priority_max(SCHED_RR);
    const bool isPermitted = isPriorityPermitted(highest);
    EXPECT_EQ(priorityOf(daemon->pid(), "probes"), isPermitted ? highest : 0);
    EXPECT_EQ(priorityOf(daemon->pid(), "replies"), isPermitted ? highest - 1 : 0);
    EXPECT_EQ(priorityOf(daemon->pid(), "clients"), 0);
    expectEndInTime();
}

TEST_F(SickMachineTest, AStoppedDaemonDoesNotDeclareThePeerDead) {
    start({"--dead-after", "0.6"});
    for (int i = 0; i < 3; ++i) {
        daemon->signal(SIGSTOP);
        std::this_thread::sleep_for(2s);  // what is tried, not what is waited for
        daemon->signal(SIGCONT);
        EXPECT_TRUE(test::eventually(20s, isPeerAlive));
    }
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("changed to dead")));
    expectEndInTime();
}

TEST_F(SickMachineTest, StepsOfTheWallClockChangeNothing) {
    start({"--dead-after", "0.6"});
    for (int i = 0; i < 5; ++i) {
        test::writeFile("/tmp/stepped-clock", "");
        EXPECT_FALSE(test::eventually(500ms, [] { return !isPeerAlive(); }));
        test::removeTree("/tmp/stepped-clock");
        EXPECT_FALSE(test::eventually(500ms, [] { return !isPeerAlive(); }));
    }
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("changed to dead")));
    peer.reset();
    test::writeFile("/tmp/stepped-clock", "");
    EXPECT_TRUE(test::eventually(5s, [] { return !isPeerAlive(); }));
    expectEndInTime();
}

// One connection that carries `request`.
std::string exchange(const std::string& request, std::chrono::seconds limit) {
    const test::Descriptor fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0), "cannot make a socket");
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::string(test::CONTROL_SOCKET).copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
    const timeval timeout = {limit.count(), 0};
    setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    EXPECT_EQ(connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    EXPECT_EQ(send(fd.get(), request.data(), request.size(), 0), static_cast<ssize_t>(request.size()));
    std::string reply(4096, '\0');
    reply.resize(
        static_cast<std::size_t>(std::max(recv(fd.get(), reply.data(), reply.size(), 0), ssize_t{0})));
    return reply;
}

TEST_F(SickMachineTest, AnOrderBlocksOnlyItsOwnClientAndASecondOneIsRefused) {
    start();
    std::thread order([] { exchange(R"({"act":"R"})", 60s); });
    EXPECT_TRUE(test::eventually(
        20s, [] { return exchange(R"({"act":"r"})", 2s).find("true") != std::string::npos; }));
    EXPECT_EQ(exchange(R"({"act":"R"})", 5s),
              "refused: an earlier order to reboot the peer is still being carried out");
    EXPECT_TRUE(isPeerAlive());
    daemon->signal(SIGKILL);
    order.join();
}

}  // namespace
