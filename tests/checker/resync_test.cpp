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
        remoteIP(test::PEER_ADDRESS);
    }
};

TEST_F(ResyncTest, ReplyHoldsTheFlag) {
    Status status;
    EXPECT_EQ(IsRemoteMDResync().handle(status), "not_resync");
    status.isMDResync = true;
    EXPECT_EQ(IsRemoteMDResync().handle(status), "resync");
    status.isMDResync = false;
    status.isRemoteMDResync = true;  // not this node's
    EXPECT_EQ(IsRemoteMDResync().handle(status), "not_resync");
}

TEST_F(ResyncTest, SendsTheRequestName) {
    test::FakePeer peer("resync");
    EXPECT_TRUE(IsRemoteMDResync()());
    EXPECT_THAT(peer.requests(), ElementsAre("is_md_resync"));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

class OtherResyncReplyTest : public ResyncTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(OtherResyncReplyTest, IsNoResyncAndNotLogged) {
    const test::FakePeer peer(GetParam());
    EXPECT_FALSE(IsRemoteMDResync()());
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(Replies, OtherResyncReplyTest,
                         ::testing::Values("not_resync", "", "Resync", "resync\n", "resync ", "alive"));

TEST_F(ResyncTest, NoReplyIsLogged) {
    const test::Stopwatch stopwatch;
    EXPECT_FALSE(IsRemoteMDResync()());
    EXPECT_GE(stopwatch.elapsed(), 2900ms);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to recv remote md resync responce")));
}

}  // namespace
