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
using test::kPeerAddress;
using ::testing::ElementsAre;

namespace {

class AliveTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        SandboxTest::SetUp();
        remoteIP(kPeerAddress);
    }

    IsRemoteAlive isRemoteAlive;
};

TEST_F(AliveTest, APeerThatAnswersAliveIsAlive) {
    FakePeer peer("alive");
    EXPECT_TRUE(isRemoteAlive());
    EXPECT_THAT(peer.questions(), ElementsAre("is_alive"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(AliveTest, AsksThroughTheBaseToo) {
    FakePeer peer("no");
    EnvCheck& check = isRemoteAlive;
    EXPECT_FALSE(check());
    EXPECT_THAT(peer.questions(), ElementsAre("is_alive"));
}

TEST_F(AliveTest, BytesAfterAZeroByteDoNotCount) {
    FakePeer peer("alive\0?"s);
    EXPECT_TRUE(isRemoteAlive());
}

TEST_F(AliveTest, ASilentPeerIsNotAliveAfterOneQuestionAndThreeSeconds) {
    test::UdpSocket peer(kPeerAddress, test::kPeerPort);
    const test::Stopwatch watch;
    EXPECT_FALSE(isRemoteAlive());
    EXPECT_GE(watch.elapsed(), 3s);
    EXPECT_LT(watch.elapsed(), 20s);
    EXPECT_THAT(test::arrived(peer), ElementsAre("is_alive"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(AliveTest, WithoutASocketThePeerIsNotAliveAndOnlyTheExchangeLogs) {
    FakePeer peer("alive");
    {
        const test::FailingCall failing("socket", EMFILE);
        EXPECT_FALSE(isRemoteAlive());
    }
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("env_check.cpp", "Failed to start socket client")));
}

TEST_F(AliveTest, AnswersAliveWhateverTheStatus) {
    Status status;
    EXPECT_EQ(isRemoteAlive.handle(status), "alive");
    status.isMDResync = true;
    status.isDiskErrHandling = true;
    status.addRemoteNodeState(TERN::HA::Daemon::NodeRebooting);
    EXPECT_EQ(isRemoteAlive.handle(status), "alive");
    EXPECT_EQ(isRemoteAlive.getType(), "is_alive");
    EXPECT_EQ(test::bufferText(), "");
}

class OtherAnswerTest : public AliveTest, public ::testing::WithParamInterface<std::string> {};

TEST_P(OtherAnswerTest, IsNotAliveAndNotLogged) {
    FakePeer peer(GetParam());
    EXPECT_FALSE(isRemoteAlive());
    EXPECT_THAT(peer.questions(), ElementsAre("is_alive"));
    EXPECT_EQ(test::bufferText(), "");
}

INSTANTIATE_TEST_SUITE_P(Answers, OtherAnswerTest,
                         ::testing::Values("", "Alive", "ALIVE", "alive\n", "alive\r\n", "alive ", " alive",
                                           "aliv", "alivee", "dead", "\0alive"s, "Undefine",
                                           "alive" + std::string(95, 'e')));

}  // namespace
