#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <ostream>

#include "checker.h"
#include "env_check/peer.h"
#include "support/json.h"
#include "support/sandbox.h"

namespace {

using namespace TERN::HA::Daemon;
using test::parsed;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class PeerDisksTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        remoteIP(test::PEER_ADDRESS);
    }

    Json::Value disks{"unchanged"};
};

// ---- The replying side ----

TEST_F(PeerDisksTest, ReplyHoldsFlagAndDisks) {
    Status status;
    EXPECT_EQ(IsRemoteDiskErrHandling().handle(status),
              R"({"errHandlingDisk":[],"isDiskErrHandling":false})");
    status.isDiskErrHandling = true;
    status.setErrHandlingDisk(parsed(R"(["sdb","sda"])"));
    status.setErrHandlingDiskRemote(parsed(R"(["sdx"])"));  // not this node's
    EXPECT_EQ(IsRemoteDiskErrHandling().handle(status),
              R"({"errHandlingDisk":["sda","sdb"],"isDiskErrHandling":true})");
}

TEST_F(PeerDisksTest, ReplyWithThreeDisksIsTruncated) {
    for (const auto& [own, isReadable] :
         {std::pair(R"(["sda","sdb"])", true), std::pair(R"(["sda","sdb","sdc"])", false)}) {
        Status status;
        status.isDiskErrHandling = true;
        status.setErrHandlingDisk(parsed(own));
        const test::FakePeer peer(IsRemoteDiskErrHandling().handle(status));
        disks = "unchanged";
        EXPECT_EQ(IsRemoteDiskErrHandling()(disks), isReadable);
        EXPECT_EQ(disks, isReadable ? parsed(own) : Json::Value("unchanged"));
    }
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to parse remote disk error info")));
}

// ---- The requesting side ----

TEST_F(PeerDisksTest, SendsTheRequestName) {
    test::FakePeer peer("{}");
    IsRemoteDiskErrHandling()(disks);
    EXPECT_THAT(peer.requests(), ElementsAre("is_disk_err_handling"));
}

struct DisksReply {
    const char* text;
    bool result;
    const char* disks;
};

void PrintTo(const DisksReply& reply, std::ostream* stream) {
    *stream << reply.text;
}

class ValidDisksReplyTest : public PeerDisksTest, public ::testing::WithParamInterface<DisksReply> {};

TEST_P(ValidDisksReplyTest, YieldsFlagAndDisksAsSent) {
    const test::FakePeer peer(GetParam().text);
    EXPECT_EQ(IsRemoteDiskErrHandling()(disks), GetParam().result);
    EXPECT_EQ(disks, parsed(GetParam().disks));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(
    Replies, ValidDisksReplyTest,
    ::testing::Values(
        DisksReply{R"({"isDiskErrHandling":true,"errHandlingDisk":["sda","sdb"]})", true, R"(["sda","sdb"])"},
        DisksReply{R"({"isDiskErrHandling":false,"errHandlingDisk":["sda"]})", false, R"(["sda"])"},
        DisksReply{R"({"isDiskErrHandling":true,"errHandlingDisk":[]})", true, "[]"},
        DisksReply{"{}", false, "null"}, DisksReply{"null", false, "null"}, DisksReply{"[]", false, "null"},
        DisksReply{"[true]", false, "null"}, DisksReply{"7", false, "null"},
        DisksReply{"true", false, "null"}, DisksReply{R"("text")", false, "null"},
        DisksReply{R"({"isDiskErrHandling":true})", true, "null"},
        DisksReply{R"({"errHandlingDisk":{"a":1}})", false, R"({"a":1})"},
        DisksReply{R"({"isDiskErrHandling":1,"errHandlingDisk":"sda"})", true, R"("sda")"},
        DisksReply{R"({"isDiskErrHandling":null})", false, "null"},
        DisksReply{"{ /* c */ \"isDiskErrHandling\" : true\n}", true, "null"}));

class InvalidDisksReplyTest : public PeerDisksTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(InvalidDisksReplyTest, IsLoggedAndLeavesDisksUnchanged) {
    const test::FakePeer peer(GetParam());
    EXPECT_FALSE(IsRemoteDiskErrHandling()(disks));
    EXPECT_EQ(disks, "unchanged");
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to parse remote disk error info")));
}

INSTANTIATE_TEST_SUITE_P(Replies, InvalidDisksReplyTest,
                         ::testing::Values("", "alive",
                                           R"({"errHandlingDisk":["sda","sdb","sdc"],"isDiskErr)",
                                           "[[[[[[[[[[[[[[[[[[[[", R"({"isDiskErrHandling":"true"})",
                                           R"({"isDiskErrHandling":[true]})",
                                           R"({"isDiskErrHandling":{},"errHandlingDisk":["sda"]})"));

TEST_F(PeerDisksTest, NoReplyIsLoggedAndLeavesDisksUnchanged) {
    EXPECT_FALSE(IsRemoteDiskErrHandling()(disks));
    EXPECT_EQ(disks, "unchanged");
    EXPECT_THAT(
        test::daemonLogMessages(),
        ElementsAre(test::LogLine("checker.cpp", "Failed to recv remote disk error handling responce")));
}

}  // namespace
