#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "checker.h"
#include "env_check/peer.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using namespace TERN::HA::Daemon;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class ResyncTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        remoteIP(test::kPeerAddress);
    }
};

TEST_F(ResyncTest, TheAnswerTellsTheFlag) {
    Status status;
    EXPECT_EQ(IsRemoteMDResync().handle(status), "not_resync");
    status.isMDResync = true;
    EXPECT_EQ(IsRemoteMDResync().handle(status), "resync");
    status.isMDResync = false;
    status.isRemoteMDResync = true;  // not this node's
    EXPECT_EQ(IsRemoteMDResync().handle(status), "not_resync");
}

TEST_F(ResyncTest, ThePeerIsAskedByName) {
    test::FakePeer peer("resync");
    EXPECT_TRUE(IsRemoteMDResync()());
    EXPECT_THAT(peer.questions(), ElementsAre("is_md_resync"));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

class OtherResyncAnswerTest : public ResyncTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(OtherResyncAnswerTest, IsNoResyncAndNotLogged) {
    const test::FakePeer peer(GetParam());
    EXPECT_FALSE(IsRemoteMDResync()());
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(Answers, OtherResyncAnswerTest,
                         ::testing::Values("not_resync", "", "Resync", "resync\n", "resync ", "alive"));

TEST_F(ResyncTest, NoAnswerLeavesALine) {
    const test::Stopwatch stopwatch;
    EXPECT_FALSE(IsRemoteMDResync()());
    EXPECT_GE(stopwatch.elapsed(), 2900ms);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to recv remote md resync responce")));
}

}  // namespace
