#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "checker.h"
#include "checker/obedient_peer.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using namespace TERN::HA::Daemon;
using ::testing::ElementsAre;

class SlowRebootTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        remoteIP("127.0.0.2");
        status.setRemoteAlive(true);
    }

    Status status;
    test::Stopwatch stopwatch;
};

TEST_F(SlowRebootTest, WaitForALivingPeerEndsAfterThirtySeconds) {
    const test::ObedientPeer peer;
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_GE(stopwatch.elapsed(), 30s);
    EXPECT_LT(stopwatch.elapsed(), 45s);
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive | NodeRebooting);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("status.cpp", "Remote server status changed to alive")));
}

TEST_F(SlowRebootTest, MissingReplyDelaysTheWaitByThreeSeconds) {
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_GE(stopwatch.elapsed(), 33s);
    EXPECT_LT(stopwatch.elapsed(), 50s);
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive | NodeRebooting);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("status.cpp", "Remote server status changed to alive"),
                            test::LogLine("checker.cpp", "Failed to reboot remote, but keep checking")));
}

TEST_F(SlowRebootTest, WaitEndsWhenThePeerIsDeclaredDead) {
    const test::ObedientPeer peer;
    std::thread liveness([this] {
        EXPECT_TRUE(test::eventually(10s, [this] { return status.isRemoteRebooting(); }));
        EXPECT_TRUE(test::eventually(20s, [since = test::Stopwatch()] { return since.elapsed() > 2500ms; }));
        status.setRemoteAlive(false);
    });
    EXPECT_TRUE(RebootRemote()(status));
    liveness.join();
    EXPECT_GE(stopwatch.elapsed(), 3s);  // it is looked at once a second
    EXPECT_LT(stopwatch.elapsed(), 15s);
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("status.cpp", "Remote server status changed to alive"),
                            test::LogLine("status.cpp", "Remote server status changed to dead"),
                            test::LogLine("checker.cpp", "Remote offline")));
}

}  // namespace
