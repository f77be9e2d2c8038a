#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <sstream>
#include <thread>

#include "ternhad/control_tool.h"
#include "ternhad/sick_machine.h"

namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;
using ::testing::Not;

// The calls of the daemon fail or hang as files tell, see sick_machine.cpp.
class FailingCallsTest : public test::SickMachineTest {
 protected:
    void SetUp() override {
        SickMachineTest::SetUp();
        prefix = {"/usr/bin/env", std::string("LD_PRELOAD=") + SICK_MACHINE};
    }
};

// Not with sanitizers either, which need descriptors of their own.
TEST_F(FailingCallsTest, LackOfDescriptorsMeansNeitherDeadPeerNorDiskErrors) {
    start();
    // The daemon holds its first ten descriptors for good; what a program that runs takes comes later.
    const rlim_t limit = 10;
    const std::string descriptors = "/proc/" + std::to_string(daemon->pid()) + "/fd/";
    for (rlim_t number = 0; number < limit; ++number) {
        ASSERT_TRUE(std::filesystem::is_symlink(descriptors + std::to_string(number)));
    }
    rlimit usual = {};
    ASSERT_EQ(prlimit(daemon->pid(), RLIMIT_NOFILE, nullptr, &usual), 0);
    const rlimit none = {limit, usual.rlim_max};
    ASSERT_EQ(prlimit(daemon->pid(), RLIMIT_NOFILE, &none, nullptr), 0);
    const test::Descriptor client = test::connectedClient();
    EXPECT_FALSE(test::eventually(6s, [] {
        const std::string log = test::wholeLog();
        return log.find("changed to dead") != std::string::npos;
    }));
    ASSERT_EQ(prlimit(daemon->pid(), RLIMIT_NOFILE, &usual, nullptr), 0);
    EXPECT_TRUE(test::eventually(20s, [] { return isPeerAlive(); }));
    // Disk errors of the peer would have been recorded.
    EXPECT_THAT(test::wholeLog("", "ha.daemon.record"), Not(HasSubstr("\"isRemoteDiskErrHandling\":true")));
    const auto logs = [](const std::string& line) {
        return test::eventually(20s, [&] { return test::wholeLog().find(line) != std::string::npos; });
    };
    EXPECT_TRUE(logs("Can accept control clients again\n"));  // the log could not be opened before
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("changed to dead")));
    expectEndInTime();
}

TEST_F(FailingCallsTest, ConnectionsThatCannotBeAcceptedAreLoggedOnce) {
    start();
    test::writeFile("/tmp/no-connections", "");
    const test::Descriptor client = test::connectedClient();
    const auto count = [](const std::string& line) {
        const std::string log = test::wholeLog();
        int lines = 0;
        for (auto at = log.find(line); at != std::string::npos; at = log.find(line, at + 1)) {
            ++lines;
        }
        return lines;
    };
    const std::string lack = "Cannot accept control clients: Cannot allocate memory\n";
    EXPECT_TRUE(test::eventually(20s, [&] { return count(lack) == 1; }));
    EXPECT_FALSE(test::eventually(6s, [&] { return count(lack) == 2; }));
    test::removeTree("/tmp/no-connections");
    EXPECT_TRUE(test::eventually(20s, [&] { return count("Can accept control clients again\n") == 1; }));
    EXPECT_TRUE(isPeerAlive());
    expectEndInTime();
}

TEST_F(FailingCallsTest, WithoutThreadsItDoesNotStart) {
    test::writeFile("/tmp/no-threads", "");
    startAlone();
    const auto status = daemon->waitFor(20s);
    ASSERT_TRUE(status.has_value());
    EXPECT_EQ(WEXITSTATUS(*status), 1);
    EXPECT_TRUE(says("ternhad: cannot start its threads: Resource temporarily unavailable\n"));
}

TEST_F(FailingCallsTest, UnsentProbesAreLoggedOnceAndKeepThePeerAlive) {
    start({"--dead-after", "0.6"});
    test::writeFile("/tmp/no-buffers", "");
    EXPECT_TRUE(test::eventually(20s, [] {
        return test::wholeLog().find("Cannot send liveness probes: No buffer space available\n") !=
               std::string::npos;
    }));
    EXPECT_FALSE(test::eventually(3s, [] { return !isPeerAlive(); }));
    test::removeTree("/tmp/no-buffers");
    EXPECT_TRUE(test::eventually(
        20s, [] { return test::wholeLog().find("Can send liveness probes again\n") != std::string::npos; }));
    const std::string log = test::wholeLog();
    EXPECT_EQ(log.find("Cannot send"), log.rfind("Cannot send"));
    EXPECT_THAT(log, Not(HasSubstr("changed to dead")));
    peer.reset();
    EXPECT_TRUE(test::eventually(20s, [] { return !isPeerAlive(); }));
    expectEndInTime();
}

TEST_F(FailingCallsTest, UnsentProbesFromTheStartLeaveThePeerUnknown) {
    test::writeFile("/tmp/no-buffers", "");
    startAlone({"--dead-after", "0.6"});
    EXPECT_FALSE(test::eventually(3s, [this] { return says("peer-dead"); }));
    test::removeTree("/tmp/no-buffers");
    EXPECT_TRUE(test::eventually(20s, [this] { return says("peer-alive (was unknown)"); }));
    expectEndInTime();
}

TEST_F(FailingCallsTest, HungSyncDoesNotPreventAReboot) {
    start();
    test::writeFile("/tmp/hanging-sync", "");
    orderReboot();
    EXPECT_TRUE(test::eventually(20s, isRebooted));
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

// Nothing in it spins: that would get as much as what spins here, however busy the machine is.
void expectIdle(pid_t process) {
    const double before = processorTime(process);
    const double own = processorTime(getpid());
    const test::Stopwatch stopwatch;
    while (stopwatch.elapsed() < 2s) {
    }
    EXPECT_LT(processorTime(process) - before, (processorTime(getpid()) - own) / 3 + 0.1);
}

TEST_F(FailingCallsTest, LateFlushCostsNoProcessorTime) {
    test::removeTree(test::TRIGGER);
    test::makeDirectories(test::TRIGGER);
    start();
    test::writeFile("/tmp/hanging-sync", "");
    orderReboot();
    ASSERT_TRUE(test::eventually(20s, [] {
        return test::wholeLog().find("Cannot reboot at the peer's request: Is a directory") !=
               std::string::npos;
    }));
    test::removeTree("/tmp/hanging-sync");
    expectIdle(daemon->pid());
    expectEndInTime();
}

TEST_F(FailingCallsTest, FollowerCostsNoProcessorTime) {
    start();
    const test::Process follower({TERNHACTL, "events"});
    peer.reset();
    ASSERT_TRUE(test::eventually(20s, [&] { return !follower.output().empty(); }));
    expectIdle(daemon->pid());
    expectEndInTime();
}

TEST_F(FailingCallsTest, FrozenDisksDoNotPreventARestart) {
    start();
    expectEndInTime();
    test::writeFile("/tmp/frozen-disks", "");
    start();
    expectEndInTime();
}

TEST_F(FailingCallsTest, WallClockStepsChangeNothing) {
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

#ifndef IS_EMULATED  // user-mode emulation has no ptrace and no memory limits, but threads of its own
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

// Holds one thread of a process.
class HeldThread {
 public:
    HeldThread(pid_t process, const std::string& name) {
        for (const auto& task :
             std::filesystem::directory_iterator("/proc/" + std::to_string(process) + "/task")) {
            if (test::readFile(task.path() / "comm") == name + "\n") {
                _thread = std::stoi(task.path().filename());
            }
        }
        EXPECT_EQ(ptrace(PTRACE_SEIZE, _thread, nullptr, nullptr), 0) << name;
        EXPECT_EQ(ptrace(PTRACE_INTERRUPT, _thread, nullptr, nullptr), 0);
        EXPECT_EQ(waitpid(_thread, nullptr, __WALL), _thread);
    }
    ~HeldThread() { ptrace(PTRACE_DETACH, _thread, nullptr, nullptr); }

    HeldThread(const HeldThread&) = delete;
    HeldThread& operator=(const HeldThread&) = delete;

 private:
    pid_t _thread = -1;
};

// Changes of flags since the daemon's start.
int transitions() {
    std::istringstream metrics(test::control("metrics").output);
    int sum = 0;
    for (std::string line; std::getline(metrics, line);) {
        if (line.rfind("ternha_transitions_total{", 0) == 0) {
            sum += std::stoi(line.substr(line.find(' ')));
        }
    }
    return sum;
}

TEST_F(FailingCallsTest, LostChangesAreReported) {
    daemon.emplace(std::vector<std::string>{TERNHAD, "--local-ip", "127.0.0.1", "--remote-ip", "127.0.0.2",
                                            "--interface", "lo", "--check-interval", "0.05"});
    ASSERT_TRUE(test::eventually(20s, [] { return isPeerAlive(); }));
    test::Process follower({TERNHACTL, "events"});
    int count = 0;
    const auto change = [&count] {
        const bool isEven = ++count % 2 == 0;
        test::writeFile("/sys/block/md0/md/sync_action", isEven ? "resync\n" : "idle\n");
        test::writeFile("/proc/drbd", isEven ? " 0: cs:Connected\n" : " 0: cs:StandAlone\n");
    };
    const auto isFollowed = [&] {
        change();
        return follower.output().find(" resync (was ") != std::string::npos;
    };
    ASSERT_TRUE(test::eventually(20s, isFollowed));
    {
        const HeldThread streams(daemon->pid(), "streams");
        const HeldThread journal(daemon->pid(), "journal");
        const int before = transitions();
        const auto isTooMuch = [&] {
            for (int i = 0; i < 20; ++i) {
                change();
                std::this_thread::sleep_for(60ms);  // a round
            }
            return transitions() > before + 260;
        };
        ASSERT_TRUE(test::eventually(120s, isTooMuch));
    }
    const std::string message = " changes lost\n";
    const auto isReported = [&] { return follower.output().find(message) != std::string::npos; };
    EXPECT_TRUE(test::eventually(10s, isReported));
    EXPECT_TRUE(test::eventually(10s, [&] { return says(message); }));
    expectEndInTime();
}

TEST_F(FailingCallsTest, HungLogKeeperIsReplacedAndLeftBehind) {
    test::replaceProgram("/bin/xz", ": > /tmp/compressing; exec sleep 600");
    start({"--log-interval", "3600", "--dead-after", "0.6"});
    const pid_t keeper = test::childOf(daemon->pid());
    ASSERT_GT(keeper, 0);
    daemon->signal(SIGHUP);
    ASSERT_TRUE(test::eventually(20s, [] { return test::exists("/tmp/compressing"); }));
    const Undying undying(keeper);
    test::restoreProgram("/bin/xz");
    test::writeFile("/tmp/an-hour-later", "");
    EXPECT_TRUE(test::eventually(20s, [&] {
        daemon->signal(SIGHUP);
        return test::wholeLog().find("The log keeper hangs: replacing it") != std::string::npos;
    }));
    EXPECT_TRUE(test::eventually(20s, [] { return test::exists("/var/log/ha/ha.daemon.log.0.xz"); }));
    EXPECT_EQ(kill(keeper, 0), 0) << "it is not left behind, but gone";
    EXPECT_TRUE(isPeerAlive());
    EXPECT_FALSE(says("peer-dead"));
    test::removeTree("/tmp/an-hour-later");
    expectEndInTime();
    EXPECT_EQ(kill(keeper, 0), 0);
}

TEST_F(FailingCallsTest, LogKeeperHasANameOfItsOwn) {
    start();
    const std::string name = "/proc/" + std::to_string(test::childOf(daemon->pid())) + "/comm";
    EXPECT_TRUE(test::eventually(10s, [&] { return test::readFile(name) == "ternhad-logs\n"; }));
    expectEndInTime();
}

TEST_F(FailingCallsTest, RebootWaitsForLinesThatAreNotLoggedYet) {
    start({"--log-interval", "3600", "--dead-after", "0.6"});
    {
        const HeldThread events(daemon->pid(), "events");
        peer.reset();
        ASSERT_TRUE(test::eventually(10s, [] { return !isPeerAlive(); }));
        orderReboot();
        EXPECT_FALSE(test::eventually(500ms, isRebooted));
    }
    EXPECT_TRUE(test::eventually(10s, isRebooted));
    EXPECT_THAT(test::readFile(test::LOG_FILE), HasSubstr("changed to dead\n"));
}

// Nobody but root may usually lock more memory than a limit.
bool isLockingPermitted() {
    rlimit limit = {};
    getrlimit(RLIMIT_MEMLOCK, &limit);
    const std::size_t size = (limit.rlim_cur == RLIM_INFINITY ? 0 : limit.rlim_cur) + 4096;
    void* const memory = mmap(nullptr, size, PROT_READ, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    const bool isPermitted = memory != MAP_FAILED && mlock2(memory, size, MLOCK_ONFAULT) == 0;
    munmap(memory, size);
    return isPermitted;
}

TEST_F(FailingCallsTest, MemoryInUseStaysInMemory) {
    start();
    const std::string status = "/proc/" + std::to_string(daemon->pid()) + "/status";
    if (isLockingPermitted()) {
        EXPECT_TRUE(test::eventually(10s, [&] {
            return test::readFile(status).find("VmLck:\t       0 kB") == std::string::npos;
        })) << test::readFile(status);
    }
    expectEndInTime();
}

TEST_F(FailingCallsTest, SnapshotLeavesOutWhatDoesNotFitItsMemory) {
    test::replaceProgram("/bin/ps", "echo PROCESSES; head -c 100000000 /dev/zero | tr '\\0' x");
    start({"--snapshot-interval", "3600"});
    EXPECT_TRUE(test::eventually(
        20s, [] { return test::wholeLog("", "ha.daemon.record").find("MemTotal:") != std::string::npos; }));
    const std::string record = test::wholeLog("", "ha.daemon.record");
    EXPECT_THAT(record, HasSubstr("Mounted on"));
    EXPECT_THAT(record, Not(HasSubstr("PROCESSES")));
    test::restoreProgram("/bin/ps");
    expectEndInTime();
}
#endif

// It is looked at before it is read, and an order must not slip through between the two.
TEST_F(FailingCallsTest, StatusSocketRefusesARebootRequestInPieces) {
    start({"--status-socket", "/run/ternha/status.sock", "--status-group", "root"});
    test::writeFile("/tmp/slow-client", "");
    const auto order = test::control("--socket /run/ternha/status.sock reboot-peer --yes");
    EXPECT_EQ(order.exitCode, 2);  // it cannot know
    EXPECT_THAT(order.output, HasSubstr(": the connection was closed without a reply\n"));
    EXPECT_FALSE(peer->isOrdered());
    EXPECT_FALSE(test::statusAt("/run/ternha/status.sock").isNull());
}

TEST_F(FailingCallsTest, MoveOfTheLogFlushesItsDisk) {
    start({"--log-interval", "3600"});
    EXPECT_FALSE(test::exists("/tmp/flushed"));
    daemon->signal(SIGHUP);
    const auto isFlushed = [] {
        return test::exists("/tmp/flushed") && test::readFile("/tmp/flushed") == "/var/log/ha";
    };
    EXPECT_TRUE(test::eventually(20s, isFlushed));
    expectEndInTime();
}

}  // namespace
