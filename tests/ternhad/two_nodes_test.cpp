#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <thread>

#include "support/sandbox.h"
#include "ternhad/machine.h"

namespace {

using namespace std::chrono_literals;
using test::Machine;
using ::testing::Contains;
using ::testing::HasSubstr;

class TwoNodesTest : public ::testing::Test {
 protected:
    TwoNodesTest() {
        test::connect(a.node, "10.0.0.1", b.node, "10.0.0.2");
        a.start();
        b.start();
        EXPECT_TRUE(test::eventually(20s, [this] { return bothSee(true); }));
    }

    bool bothSee(bool alive) { return a.sees("isRemoteAlive", alive) && b.sees("isRemoteAlive", alive); }

    Machine a{"node-a", "10.0.0.1", "10.0.0.2"};
    Machine b{"node-b", "10.0.0.2", "10.0.0.1"};
};

TEST_F(TwoNodesTest, LearnThePeersLivenessAndName) {
    for (Machine* machine : {&a, &b}) {
        EXPECT_TRUE(test::eventually(10s, [&] {
            return machine->log().find("Remote hostname is " +
                                       std::string(machine == &a ? "node-b" : "node-a") + "\n") !=
                   std::string::npos;
        })) << machine->log();
        EXPECT_THAT(test::messages(machine->log()),
                    Contains(test::LogLine("status.cpp", "Remote server status changed to alive")).Times(1));
    }
}

TEST_F(TwoNodesTest, DetectACutLinkAndItsReturn) {
    test::setLink(a.node, false);
    EXPECT_TRUE(test::eventually(20s, [this] { return bothSee(false); }));
    test::setLink(a.node, true);
    EXPECT_TRUE(test::eventually(20s, [this] { return bothSee(true); }));
    for (Machine* machine : {&a, &b}) {
        // The log follows the state.
        const auto twice =
            Contains(test::LogLine("status.cpp", "Remote server status changed to alive")).Times(2);
        EXPECT_TRUE(
            test::eventually(10s, [&] { return ::testing::Matches(twice)(test::messages(machine->log())); }));
        EXPECT_THAT(test::messages(machine->log()),
                    Contains(test::LogLine("status.cpp", "Remote server status changed to dead")).Times(1));
    }
}

TEST(TwoNodesWithStatusSocketsTest, SurviveACutLink) {
    Machine a{"node-a", "10.0.0.1", "10.0.0.2"};
    Machine b{"node-b", "10.0.0.2", "10.0.0.1"};
    test::connect(a.node, "10.0.0.1", b.node, "10.0.0.2");
    for (Machine* machine : {&a, &b}) {
        machine->start({"--status-socket", "/run/ternha/status.sock", "--status-group", "daemon",
                        "--dead-after", "0.6"});
    }
    const auto bothSee = [&](bool alive) {
        return a.sees("isRemoteAlive", alive) && b.sees("isRemoteAlive", alive);
    };
    ASSERT_TRUE(test::eventually(20s, [&] { return bothSee(true); }));
    for (int i = 0; i < 3; ++i) {
        test::setLink(a.node, false);
        EXPECT_TRUE(test::eventually(20s, [&] { return bothSee(false); }));
        test::setLink(a.node, true);
        EXPECT_TRUE(test::eventually(20s, [&] { return bothSee(true); }));
    }
    for (Machine* machine : {&a, &b}) {
        EXPECT_FALSE(machine->daemon->waitFor(0s).has_value()) << "ended: " << machine->log();
    }
}

TEST_F(TwoNodesTest, StoppedDaemonIsDeadUntilItContinues) {
    b.daemon->signal(SIGSTOP);
    EXPECT_TRUE(test::eventually(20s, [this] { return a.sees("isRemoteAlive", false); }));
    b.daemon->signal(SIGCONT);
    EXPECT_TRUE(test::eventually(20s, [this] { return bothSee(true); }));
}

TEST(SuspendedDaemonTest, IsUpToDateWithinTwoIntervals) {
    constexpr auto INTERVAL = 3s;
    Machine a{"node-a", "10.0.0.1", "10.0.0.2"};
    Machine b{"node-b", "10.0.0.2", "10.0.0.1"};
    test::connect(a.node, "10.0.0.1", b.node, "10.0.0.2");
    for (Machine* machine : {&a, &b}) {
        machine->daemon.emplace(
            machine->node.start({TERNHAD, "--local-ip", machine->address, "--remote-ip", machine->peer,
                                 "--interface", "eth1", "--check-interval", std::to_string(INTERVAL.count()),
                                 "--dead-after", std::to_string(3 * INTERVAL.count())}));
    }
    const auto isTrue = [&](bool isResync) {
        return a.sees("isRemoteAlive", true) && b.sees("isRemoteAlive", true) &&
               a.sees("isRemoteMDResync", isResync) && b.sees("isMDResync", isResync);
    };
    ASSERT_TRUE(test::eventually(20s, [&] { return isTrue(false); }));
    b.daemon->signal(SIGSTOP);
    ASSERT_TRUE(test::eventually(20s, [&] { return a.sees("isRemoteAlive", false); }));
    b.write("/sys/block/md0/md/sync_action", "resync\n");
    b.daemon->signal(SIGCONT);
    constexpr auto SLACK = 2s;  // for a busy machine
    EXPECT_TRUE(test::eventually(2 * INTERVAL + SLACK, [&] { return isTrue(true); }));
}

TEST_F(TwoNodesTest, KilledDaemonIsDeadUntilItIsRestarted) {
    b.daemon->signal(SIGKILL);
    ASSERT_TRUE(b.daemon->waitFor(10s).has_value());
    EXPECT_TRUE(test::eventually(20s, [this] { return a.sees("isRemoteAlive", false); }));
    b.start();
    EXPECT_TRUE(test::eventually(20s, [this] { return bothSee(true); }));
}

TEST_F(TwoNodesTest, ReportResyncsAndDiskErrorsToEachOther) {
    a.write("/sys/block/md0/md/sync_action", "resync\n");
    EXPECT_TRUE(test::eventually(20s, [this] { return b.sees("isRemoteMDResync", true); }));
    EXPECT_FALSE(b.status()["isMDResync"].asBool());

    a.write("/sys/class/ata_port/ata3/error_handling", "1\n");
    EXPECT_TRUE(test::eventually(20s, [this] {
        const Json::Value status = b.status();
        return status["isRemoteDiskErrHandling"].asBool() &&
               status["diskErrorHandlingDiskRemote"].size() == 1 &&
               status["diskErrorHandlingDiskRemote"][0] == "sda";
    })) << b.status();

    a.write("/sys/block/md0/md/sync_action", "recover\n");
    a.write("/sys/class/ata_port/ata3/error_handling", "0\n");
    EXPECT_TRUE(test::eventually(20s, [this] {
        const Json::Value status = b.status();
        return !status["isRemoteMDResync"].asBool() && !status["isRemoteDiskErrHandling"].asBool() &&
               status["diskErrorHandlingDiskRemote"].empty();
    })) << b.status();
}

TEST_F(TwoNodesTest, TakeASnapshotWhenThePeerIsDeadOrResyncs) {
    ASSERT_TRUE(test::eventually(10s, [&] { return b.record().find("MemTotal") != std::string::npos; }));

    const std::string atStart = b.record();
    a.write("/sys/block/md0/md/sync_action", "resync\n");
    EXPECT_TRUE(test::eventually(20s, [&] {
        return b.record().find("\"isRemoteMDResync\":true", atStart.size()) != std::string::npos;
    }));

    const std::size_t before = b.record().size();
    a.daemon->signal(SIGKILL);
    EXPECT_TRUE(test::eventually(
        20s, [&] { return b.record().find("\"isRemoteAlive\":false", before) != std::string::npos; }));
}

TEST_F(TwoNodesTest, MeasureTheLinkWhileThePeerIsAlive) {
    EXPECT_TRUE(test::eventually(20s, [this] { return a.status()["heartbeatLatency"].asDouble() > 0; }));
    EXPECT_EQ(a.status()["heartbeatPacketFailRate"].asDouble(), 0);
    test::setLink(b.node, false);
    EXPECT_TRUE(test::eventually(30s, [this] {
        return a.sees("isRemoteAlive", false) && a.status()["heartbeatLatency"].asDouble() <= 0;
    }));
}

TEST_F(TwoNodesTest, RebootReachesThePeersKernelWithItsLogsOnDisk) {
    bool isDone = false;
    std::thread order([&] {
        isDone = TERN::HA::Daemon::MonitordSocket(a.node.path(test::CONTROL_SOCKET), 40).rebootRemote();
    });
    ASSERT_TRUE(
        test::eventually(20s, [this] { return test::readFile(b.node.path("/proc/sysrq-trigger")) == "b"; }));
    EXPECT_THAT(test::readFile(b.node.path("/var/log/ha/ha.daemon.log")),
                HasSubstr("Remote server status changed to alive\n"));
    b.daemon->signal(SIGKILL);
    order.join();
    EXPECT_TRUE(isDone);
    EXPECT_TRUE(
        test::eventually(10s, [this] { return a.log().find(" Remote offline\n") != std::string::npos; }));
    EXPECT_TRUE(TERN::HA::Daemon::MonitordSocket(a.node.path(test::CONTROL_SOCKET), 5).isRebootRemote());

    b.write("/proc/sysrq-trigger", "");
    b.start();
    EXPECT_TRUE(test::eventually(20s, [this] { return bothSee(true); }));
    EXPECT_FALSE(TERN::HA::Daemon::MonitordSocket(a.node.path(test::CONTROL_SOCKET), 5).isRebootRemote());
}

}  // namespace
