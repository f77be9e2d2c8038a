#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <future>
#include <mutex>
#include <vector>

#include "checker.h"
#include "checker/obedient_peer.h"
#include "faults/clock.h"
#include "ha_log.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/udp.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using namespace TERN::HA::Daemon;
using ::testing::AllOf;
using ::testing::Contains;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::SizeIs;

constexpr char TRIGGER[] = "/proc/sysrq-trigger";

class RebootTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        remoteIP("127.0.0.2");
    }

    Status status;
};

// ---- The requesting side ----

TEST_F(RebootTest, InheritedOperatorsSendNothing) {
    test::UdpSocket peer("127.0.0.2", 7499);
    RebootRemote reboot;
    EnvCheck& check = reboot;
    Json::Value out("unchanged");
    EXPECT_TRUE(check());
    EXPECT_TRUE(check(out));
    EXPECT_EQ(out, "unchanged");
    EXPECT_FALSE(peer.receive(0ms).has_value());
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(RebootTest, DeadPeerIsOfflineAtOnce) {
    const test::ObedientPeer peer;
    const test::FastSleep noSleep([](int) {});
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_THAT(test::FastSleep::sleeps(), IsEmpty());
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre(test::LogLine("checker.cpp", "Remote offline")));
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
}

TEST_F(RebootTest, MissingReplyIsLoggedAndTheWaitContinues) {
    const test::FastSleep noSleep([](int) {});
    const test::Stopwatch stopwatch;
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_GE(stopwatch.elapsed(), 2900ms);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to reboot remote, but keep checking"),
                            test::LogLine("checker.cpp", "Remote offline")));
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
}

TEST_F(RebootTest, StateChangesOnlyAfterTheExchange) {
    status.setRemoteAlive(true);
    const test::ObedientPeer peer([this] {
        EXPECT_EQ(status.getRemoteNodeState(), NodeAlive);
        return true;
    });
    const test::FastSleep noSleep([](int) {});
    RebootRemote()(status);
}

TEST_F(RebootTest, PeerDeclaredDeadDuringTheRequestIsOfflineAtOnce) {
    status.setRemoteAlive(true);
    const test::ObedientPeer peer([this] {
        status.setRemoteAlive(false);
        return false;
    });
    const test::FastSleep noSleep([](int) {});
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_THAT(test::FastSleep::sleeps(), IsEmpty());
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("status.cpp", "Remote server status changed to alive"),
                            test::LogLine("status.cpp", "Remote server status changed to dead"),
                            test::LogLine("checker.cpp", "Failed to reboot remote, but keep checking"),
                            test::LogLine("checker.cpp", "Remote offline")));
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
}

TEST_F(RebootTest, WaitsForASilentPeerUntilItIsDeclaredDead) {
    status.setRemoteAlive(true);
    const test::FastSleep sleep([this](int number) {
        if (number == 2) {
            status.setRemoteAlive(false);
        }
    });
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_THAT(test::FastSleep::sleeps(), SizeIs(2));
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("status.cpp", "Remote server status changed to alive"),
                            test::LogLine("checker.cpp", "Failed to reboot remote, but keep checking"),
                            test::LogLine("status.cpp", "Remote server status changed to dead"),
                            test::LogLine("checker.cpp", "Remote offline")));
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
}

// A held lock delays each change, so that every state lasts a second.
TEST_F(RebootTest, PeerIsRebootingThroughoutTheTransition) {
    status.lockTimeout = 1;
    const std::lock_guard<std::timed_mutex> stuck(status.remoteNodeStateMutex);
    const test::ObedientPeer peer;
    auto reboot = std::async(std::launch::async, [this] { return RebootRemote()(status); });
    std::vector<unsigned int> states = {0};
    bool isOver = false;
    while (!isOver) {
        isOver = reboot.wait_for(1ms) == std::future_status::ready;
        const unsigned int state = status.getRemoteNodeState();
        if (state != states.back()) {
            states.push_back(state);
        }
    }
    EXPECT_TRUE(reboot.get());
    EXPECT_THAT(states, ElementsAre(0U, NodeRebootPending, NodeRebootPending | NodeRebooting, NodeRebooting));
}

TEST_F(RebootTest, WaitsUntilThePeerIsDeclaredDead) {
    status.setRemoteAlive(true);
    const test::ObedientPeer peer;
    const test::FastSleep sleep([this](int number) {
        // A peer may be alive and rebooting at once.
        EXPECT_EQ(status.getRemoteNodeState(), NodeAlive | NodeRebootPending);
        EXPECT_TRUE(status.isRemoteRebooting());
        if (number == 4) {
            status.setRemoteAlive(false);
        }
    });
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_THAT(test::FastSleep::sleeps(), AllOf(SizeIs(4), Each(1U)));
    EXPECT_THAT(test::daemonLogMessages().back(), test::LogLine("checker.cpp", "Remote offline"));
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
}

TEST_F(RebootTest, PeerThatStaysAliveIsCheckedThirtyTimes) {
    status.setRemoteAlive(true);
    const test::ObedientPeer peer;
    const test::FastSleep sleep([](int) {});
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_THAT(test::FastSleep::sleeps(), AllOf(SizeIs(30), Each(1U)));
    EXPECT_THAT(test::daemonLogMessages(), Not(Contains(test::LogLine("checker.cpp", "Remote offline"))));
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive | NodeRebooting);  // the alive bit is not its business
}

TEST_F(RebootTest, NoCheckFollowsTheLastSleep) {
    status.setRemoteAlive(true);
    const test::ObedientPeer peer;
    const test::FastSleep sleep([this](int number) {
        if (number == 30) {
            status.setRemoteAlive(false);
        }
    });
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_THAT(test::daemonLogMessages(), Not(Contains(test::LogLine("checker.cpp", "Remote offline"))));
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
}

// ---- The replying side ----

TEST_F(RebootTest, FlushesBothLogsAndTriggersTheReboot) {
    daemonLog->set("last words");
    recordLog->set("last snapshot");
    EXPECT_EQ(RebootRemote().handle(status), "");
    EXPECT_THAT(test::messages(test::readFile("/var/log/ha/ha.daemon.log")), ElementsAre("last words"));
    EXPECT_THAT(test::messages(test::readFile("/var/log/ha/ha.daemon.record")), ElementsAre("last snapshot"));
    EXPECT_EQ(test::bufferText(), "");
    EXPECT_EQ(test::recordText(), "");
    EXPECT_EQ(test::readFile(TRIGGER), "b");
    EXPECT_EQ(status.getRemoteNodeState(), 0U);
}

TEST_F(RebootTest, TriggerFileIsOverwritten) {
    test::writeFile(TRIGGER, "something longer");
    RebootRemote().handle(status);
    EXPECT_EQ(test::readFile(TRIGGER), "b");
}

TEST_F(RebootTest, UnopenableTriggerIsNotLogged) {
    test::removeTree(TRIGGER);
    test::makeDirectories(TRIGGER);
    daemonLog->set("last words");
    EXPECT_EQ(RebootRemote().handle(status), "");
    EXPECT_THAT(test::messages(test::readFile("/var/log/ha/ha.daemon.log")), ElementsAre("last words"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(RebootTest, MissingLogDirectoryDoesNotPreventTheReboot) {
    test::removeTree("/var/log/ha");
    daemonLog->set("lost");
    EXPECT_EQ(RebootRemote().handle(status), "");
    EXPECT_EQ(test::readFile(TRIGGER), "b");
}

}  // namespace
