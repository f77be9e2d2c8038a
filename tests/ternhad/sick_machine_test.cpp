#include "ternhad/sick_machine.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <sched.h>
#include <sys/socket.h>

#include <algorithm>
#include <filesystem>
#include <thread>

namespace {

using namespace std::chrono_literals;
using test::SickMachineTest;
using ::testing::HasSubstr;
using ::testing::Not;

TEST_F(SickMachineTest, FifoAsHostNameFileDelaysNothing) {
    ASSERT_EQ(mkfifo("/tmp/.ha.hostname.original", 0600), 0);
    start();
    EXPECT_TRUE(replies("remote_hostname"));
    EXPECT_TRUE(replies("is_alive"));
    expectEndInTime();
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("Cannot ")));
}

TEST_F(SickMachineTest, HungBufferDelaysNoStateChange) {
    start();
    test::hang(test::BUFFER_FILE);
    peer.reset();
    EXPECT_TRUE(test::eventually(6s, [] { return !isPeerAlive(); }));
    peer.emplace();
    EXPECT_TRUE(test::eventually(6s, [] { return isPeerAlive(); }));
    EXPECT_TRUE(replies("is_alive"));
    expectEndInTime();
}

TEST_F(SickMachineTest, HungBufferDoesNotPreventAReboot) {
    start();
    test::hang(test::BUFFER_FILE);
    orderReboot();
    EXPECT_TRUE(test::eventually(20s, isRebooted));
}

TEST_F(SickMachineTest, HungLogDiskDoesNotPreventAReboot) {
    start();
    test::hang(test::LOG_FILE);
    orderReboot();
    EXPECT_TRUE(test::eventually(20s, isRebooted));
    EXPECT_TRUE(replies("is_alive"));
}

TEST_F(SickMachineTest, RebootDoesNotWaitOnAHealthyMachine) {
    start();
    const test::Stopwatch stopwatch;
    orderReboot();
    EXPECT_TRUE(test::eventually(4s, isRebooted)) << "the deadline is for what hangs";
}

TEST_F(SickMachineTest, SurvivesTheReaderOfItsStandardError) {
    prefix = {"bash", "-c", R"(exec 2> >(exec true); wait $!; exec "$@")", "sh"};
    start();
    peer.reset();
    EXPECT_TRUE(test::eventually(6s, [] { return !isPeerAlive(); }));
    expectEndInTime();
}

TEST_F(SickMachineTest, FailedRebootIsReplied) {
    test::removeTree(test::TRIGGER);
    test::makeDirectories(test::TRIGGER);
    start();
    EXPECT_TRUE(replies("reboot_remote"));
    EXPECT_TRUE(test::eventually(10s, [] {
        return test::wholeLog().find("Cannot reboot at the peer's request: Is a directory") !=
               std::string::npos;
    }));
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

TEST_F(SickMachineTest, ProbesComeBeforeRepliesAndTheseBeforeTheJournalAndAllElse) {
    start();
    const int highest = sched_get_priority_max(SCHED_RR);
    const bool isPermitted = isPriorityPermitted(highest);
    EXPECT_EQ(priorityOf(daemon->pid(), "probes"), isPermitted ? highest : 0);
    EXPECT_EQ(priorityOf(daemon->pid(), "replies"), isPermitted ? highest - 1 : 0);
    EXPECT_TRUE(test::eventually(
        10s, [&] { return priorityOf(daemon->pid(), "journal") == (isPermitted ? highest - 2 : 0); }));
    EXPECT_EQ(priorityOf(daemon->pid(), "clients"), 0);
    expectEndInTime();
}

TEST_F(SickMachineTest, RequestInterruptedByAStopIsDiscarded) {
    start();
    ASSERT_TRUE(test::eventually(20s, [this] { return says("peer-no-disk-errors"); }));
    peer->beReticent();
    for (int i = 0; i < 3; ++i) {
        std::this_thread::sleep_for(1s);  // until it waits for a reply
        daemon->signal(SIGSTOP);
        std::this_thread::sleep_for(200ms);  // what is tried
        daemon->signal(SIGCONT);
        EXPECT_FALSE(test::eventually(1s, [this] { return says("peer-disk-errors"); }));
    }
    expectEndInTime();
}

TEST_F(SickMachineTest, StoppedDaemonDoesNotDeclareThePeerDead) {
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

// One connection that carries `request`.
std::string exchange(const std::string& request, std::chrono::seconds limit) {
    const test::Descriptor fd = test::connectedClient();
    const timeval timeout = {limit.count(), 0};
    setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    EXPECT_EQ(send(fd.get(), request.data(), request.size(), 0), static_cast<ssize_t>(request.size()));
    std::string reply(4096, '\0');
    reply.resize(
        static_cast<std::size_t>(std::max(recv(fd.get(), reply.data(), reply.size(), 0), ssize_t{0})));
    return reply;
}

TEST_F(SickMachineTest, RebootBlocksOnlyItsOwnClientAndASecondOneIsRefused) {
    start();
    std::thread order([] { exchange(R"({"act":"R"})", 60s); });
    EXPECT_TRUE(test::eventually(
        20s, [] { return exchange(R"({"act":"r"})", 2s).find("true") != std::string::npos; }));
    EXPECT_EQ(exchange(R"({"act":"R"})", 5s), "refused: another reboot request is still in progress");
    EXPECT_TRUE(isPeerAlive());
    daemon->signal(SIGKILL);
    order.join();
}

}  // namespace
