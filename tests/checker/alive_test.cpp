#include <cerrno>
#include <chrono>
#include <string>

#include "checker.h"
#include "env_check/peer.h"
#include "faults/failing_call.h"
#include "support/sandbox.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using namespace std::string_literals;
using TERN::HA::Daemon::IsRemoteAlive;
using TERN::HA::Daemon::Status;
using test::FakePeer;
using test::PEER_ADDRESS;
using ::testing::ElementsAre;

namespace {

class AliveTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        SandboxTest::SetUp();
        remoteIP(PEER_ADDRESS);
    }

    IsRemoteAlive isRemoteAlive;
};

TEST_F(AliveTest, PeerReplyingAliveIsAlive) {
    FakePeer peer("alive");
    EXPECT_TRUE(isRemoteAlive());
    EXPECT_THAT(peer.requests(), ElementsAre("is_alive"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(AliveTest, CallThroughBaseClassSendsTheRequest) {
    FakePeer peer("no");
    EnvCheck& check = isRemoteAlive;
    EXPECT_FALSE(check());
    EXPECT_THAT(peer.requests(), ElementsAre("is_alive"));
}

TEST_F(AliveTest, ReplyEndsAtFirstZeroByte) {
    FakePeer peer("alive\0?"s);
    EXPECT_TRUE(isRemoteAlive());
}

TEST_F(AliveTest, NoReplyWithinThreeSecondsMeansNotAlive) {
    test::UdpSocket peer(PEER_ADDRESS, test::PEER_PORT);
    const test::Stopwatch watch;
    EXPECT_FALSE(isRemoteAlive());
    EXPECT_GE(watch.elapsed(), 3s);
    EXPECT_LT(watch.elapsed(), 20s);
    EXPECT_THAT(test::arrived(peer), ElementsAre("is_alive"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(AliveTest, SocketFailureMeansNotAlive) {
    FakePeer peer("alive");
    {
        const test::FailingCall failing("socket", EMFILE);
        EXPECT_FALSE(isRemoteAlive());
    }
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("env_check.cpp", "Failed to start socket client")));
}

TEST_F(AliveTest, RepliesAliveWhateverTheStatus) {
    Status status;
    EXPECT_EQ(isRemoteAlive.handle(status), "alive");
    status.isMDResync = true;
    status.isDiskErrHandling = true;
    status.addRemoteNodeState(TERN::HA::Daemon::NodeRebooting);
    EXPECT_EQ(isRemoteAlive.handle(status), "alive");
    EXPECT_EQ(isRemoteAlive.getType(), "is_alive");
    EXPECT_EQ(test::bufferText(), "");
}

class OtherReplyTest : public AliveTest, public ::testing::WithParamInterface<std::string> {};

TEST_P(OtherReplyTest, IsNotAliveAndNotLogged) {
    FakePeer peer(GetParam());
    EXPECT_FALSE(isRemoteAlive());
    EXPECT_THAT(peer.requests(), ElementsAre("is_alive"));
    EXPECT_EQ(test::bufferText(), "");
}

INSTANTIATE_TEST_SUITE_P(Replies, OtherReplyTest,
                         ::testing::Values("", "Alive", "ALIVE", "alive\n", "alive\r\n", "alive ", " alive",
                                           "aliv", "alivee", "dead", "\0alive"s, "Undefine",
                                           "alive" + std::string(95, 'e')));

}  // namespace
