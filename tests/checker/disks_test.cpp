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

class PeersDisksTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        remoteIP(test::kPeerAddress);
    }

    Json::Value disks{"as it was"};
};

// ---- The answering side ----

TEST_F(PeersDisksTest, TheAnswerTellsTheFlagAndTheDisks) {
    Status status;
    EXPECT_EQ(IsRemoteDiskErrHandling().handle(status),
              R"({"errHandlingDisk":[],"isDiskErrHandling":false})");
    status.isDiskErrHandling = true;
    status.setErrHandlingDisk(parsed(R"(["sdb","sda"])"));
    status.setErrHandlingDiskRemote(parsed(R"(["sdx"])"));  // not this node's
    EXPECT_EQ(IsRemoteDiskErrHandling().handle(status),
              R"({"errHandlingDisk":["sda","sdb"],"isDiskErrHandling":true})");
}

TEST_F(PeersDisksTest, TwoDisksFitADatagramAndThreeDoNot) {
    for (const auto& [own, isReadable] :
         {std::pair(R"(["sda","sdb"])", true), std::pair(R"(["sda","sdb","sdc"])", false)}) {
        Status status;
        status.isDiskErrHandling = true;
        status.setErrHandlingDisk(parsed(own));
        const test::FakePeer peer(IsRemoteDiskErrHandling().handle(status));
        disks = "as it was";
        EXPECT_EQ(IsRemoteDiskErrHandling()(disks), isReadable);
        EXPECT_EQ(disks, isReadable ? parsed(own) : Json::Value("as it was"));
    }
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to parse remote disk error info")));
}

// ---- The asking side ----

TEST_F(PeersDisksTest, ThePeerIsAskedByName) {
    test::FakePeer peer("{}");
    IsRemoteDiskErrHandling()(disks);
    EXPECT_THAT(peer.questions(), ElementsAre("is_disk_err_handling"));
}

struct Answer {
    const char* text;
    bool result;
    const char* disks;
};

void PrintTo(const Answer& answer, std::ostream* stream) {
    *stream << answer.text;
}

class ReadableAnswerTest : public PeersDisksTest, public ::testing::WithParamInterface<Answer> {};

TEST_P(ReadableAnswerTest, GivesFlagAndDisksAsSent) {
    const test::FakePeer peer(GetParam().text);
    EXPECT_EQ(IsRemoteDiskErrHandling()(disks), GetParam().result);
    EXPECT_EQ(disks, parsed(GetParam().disks));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(
    Answers, ReadableAnswerTest,
    ::testing::Values(Answer{R"({"isDiskErrHandling":true,"errHandlingDisk":["sda","sdb"]})", true,
                             R"(["sda","sdb"])"},
                      Answer{R"({"isDiskErrHandling":false,"errHandlingDisk":["sda"]})", false, R"(["sda"])"},
                      Answer{R"({"isDiskErrHandling":true,"errHandlingDisk":[]})", true, "[]"},
                      Answer{"{}", false, "null"}, Answer{"null", false, "null"}, Answer{"[]", false, "null"},
                      Answer{"[true]", false, "null"}, Answer{"7", false, "null"},
                      Answer{"true", false, "null"}, Answer{R"("text")", false, "null"},
                      Answer{R"({"isDiskErrHandling":true})", true, "null"},
                      Answer{R"({"errHandlingDisk":{"a":1}})", false, R"({"a":1})"},
                      Answer{R"({"isDiskErrHandling":1,"errHandlingDisk":"sda"})", true, R"("sda")"},
                      Answer{R"({"isDiskErrHandling":null})", false, "null"},
                      Answer{"{ /* c */ \"isDiskErrHandling\" : true\n}", true, "null"}));

class UnreadableAnswerTest : public PeersDisksTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(UnreadableAnswerTest, LeavesTheDisksAloneAndALine) {
    const test::FakePeer peer(GetParam());
    EXPECT_FALSE(IsRemoteDiskErrHandling()(disks));
    EXPECT_EQ(disks, "as it was");
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to parse remote disk error info")));
}

INSTANTIATE_TEST_SUITE_P(Answers, UnreadableAnswerTest,
                         ::testing::Values("", "alive",
                                           R"({"errHandlingDisk":["sda","sdb","sdc"],"isDiskErr)",
                                           "[[[[[[[[[[[[[[[[[[[[", R"({"isDiskErrHandling":"true"})",
                                           R"({"isDiskErrHandling":[true]})",
                                           R"({"isDiskErrHandling":{},"errHandlingDisk":["sda"]})"));

TEST_F(PeersDisksTest, NoAnswerLeavesTheDisksAloneAndALine) {
    EXPECT_FALSE(IsRemoteDiskErrHandling()(disks));
    EXPECT_EQ(disks, "as it was");
    EXPECT_THAT(
        test::daemonLogMessages(),
        ElementsAre(test::LogLine("checker.cpp", "Failed to recv remote disk error handling responce")));
}

}  // namespace
