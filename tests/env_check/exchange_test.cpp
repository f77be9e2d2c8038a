#include <algorithm>
#include <cerrno>
#include <chrono>
#include <thread>
#include <vector>

#include "env_check.h"
#include "env_check/peer.h"
#include "faults/failing_call.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using namespace std::string_literals;
using test::arrived;
using test::FakePeer;
using test::kPeerAddress;
using test::kPeerPort;
using test::UdpSocket;
using ::testing::AllOf;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;

namespace {

class Question : public EnvCheck {
 public:
    using EnvCheck::_sendToRemote;
    std::string getType() override { return "question"; }
};

class NamelessQuestion : public EnvCheck {
 public:
    using EnvCheck::_sendToRemote;
};

class ExchangeTest : public test::SandboxTest {
 protected:
    Question question;
    std::string reply = "before";
};

TEST_F(ExchangeTest, SendsTheTypeNameAndTakesTheAnswer) {
    FakePeer peer("answer");
    remoteIP(kPeerAddress);
    EXPECT_TRUE(question._sendToRemote(reply));
    EXPECT_EQ(reply, "answer");
    EXPECT_THAT(peer.questions(), ElementsAre("question"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ExchangeTest, AnEmptyAnswerIsAnAnswer) {
    FakePeer peer("");
    remoteIP(kPeerAddress);
    EXPECT_TRUE(question._sendToRemote(reply));
    EXPECT_EQ(reply, "");
}

TEST_F(ExchangeTest, TheAnswerIsCutAt63Characters) {
    FakePeer peer(std::string(63, 'x') + "yyyyyyy");
    remoteIP(kPeerAddress);
    EXPECT_TRUE(question._sendToRemote(reply));
    EXPECT_EQ(reply, std::string(63, 'x'));
}

TEST_F(ExchangeTest, TheAnswerEndsAtAZeroByte) {
    FakePeer peer("ans\0wer"s);
    remoteIP(kPeerAddress);
    EXPECT_TRUE(question._sendToRemote(reply));
    EXPECT_EQ(reply, "ans");
}

TEST_F(ExchangeTest, ACheckWithoutATypeNameAsksUndefine) {
    FakePeer peer("answer");
    remoteIP(kPeerAddress);
    EXPECT_TRUE(NamelessQuestion()._sendToRemote(reply));
    EXPECT_THAT(peer.questions(), ElementsAre("Undefine"));
}

TEST_F(ExchangeTest, AsksOnceAndGivesUpAfterThreeSeconds) {
    UdpSocket peer(kPeerAddress, kPeerPort);
    remoteIP(kPeerAddress);
    const test::Stopwatch watch;
    EXPECT_FALSE(question._sendToRemote(reply));
    EXPECT_GE(watch.elapsed(), 3s);
    EXPECT_EQ(test::receiveTimeout(), 3s);
    EXPECT_EQ(reply, "before");
    EXPECT_THAT(arrived(peer), ElementsAre("question"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ExchangeTest, WithoutARemoteAddressAsks0000) {
    ASSERT_EQ(remoteIP(""), "");
    UdpSocket own("127.0.0.1", kPeerPort);
    const test::Stopwatch watch;
    EXPECT_FALSE(question._sendToRemote(reply));
    EXPECT_GE(watch.elapsed(), 3s);
    EXPECT_EQ(reply, "before");
    EXPECT_THAT(arrived(own), ElementsAre("question"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ExchangeTest, NobodyAtThePeersPortIsNoAnswer) {
    remoteIP(kPeerAddress);
    const test::Stopwatch watch;
    EXPECT_FALSE(question._sendToRemote(reply));
    EXPECT_GE(watch.elapsed(), 3s);
    EXPECT_EQ(reply, "before");
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ExchangeTest, AQuestionThatCannotBeSentIsNoAnswer) {
    remoteIP("255.255.255.255");
    const test::Stopwatch watch;
    EXPECT_FALSE(question._sendToRemote(reply));
    EXPECT_GE(watch.elapsed(), 3s);
    EXPECT_EQ(reply, "before");
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ExchangeTest, WithoutASocketNothingIsSentAndTheLogSaysSo) {
    test::SystemLog systemLog;
    UdpSocket peer(kPeerAddress, kPeerPort);
    remoteIP(kPeerAddress);
    {
        const test::FailingCall failing("socket", EMFILE);
        EXPECT_FALSE(question._sendToRemote(reply));
    }
    EXPECT_EQ(reply, "before");
    EXPECT_THAT(arrived(peer), IsEmpty());
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("env_check.cpp", "Failed to start socket client")));
    EXPECT_THAT(systemLog.texts(), ElementsAre(test::LogLine("chkstate.cpp", "Failed to set socket")));
}

TEST_F(ExchangeTest, WithoutATimeoutNothingIsSentAndTheLogSaysSo) {
    UdpSocket peer(kPeerAddress, kPeerPort);
    remoteIP(kPeerAddress);
    {
        const test::FailingCall failing("setsockopt", EDOM);
        EXPECT_FALSE(question._sendToRemote(reply));
    }
    EXPECT_EQ(reply, "before");
    EXPECT_THAT(arrived(peer), IsEmpty());
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("env_check.cpp", "Failed to start socket client")));
}

TEST_F(ExchangeTest, TakesTheFirstDatagramThatReachesItFromAnybody) {
    UdpSocket peer(kPeerAddress, kPeerPort);
    remoteIP(kPeerAddress);
    std::thread stranger([&] {
        const auto asked = peer.receive(10s);
        if (asked) {
            UdpSocket("127.0.0.3").send("from a stranger", asked->address, asked->port);
        }
    });
    EXPECT_TRUE(question._sendToRemote(reply));
    stranger.join();
    EXPECT_EQ(reply, "from a stranger");
}

TEST_F(ExchangeTest, ManyThreadsAskAtOnce) {
    constexpr int kThreads = 8;
    constexpr int kQuestions = 50;
    FakePeer peer("answer");
    remoteIP(kPeerAddress);
    std::vector<std::vector<std::string>> answers(kThreads);
    std::vector<std::thread> threads;
    for (auto& own : answers) {
        threads.emplace_back([&own] {
            for (int i = 0; i < kQuestions; ++i) {
                std::string answer;
                own.push_back(Question()._sendToRemote(answer) ? answer : "nothing");
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_THAT(answers, Each(AllOf(SizeIs(kQuestions), Each("answer"))));
    EXPECT_THAT(peer.questions(), AllOf(SizeIs(kThreads * kQuestions), Each("question")));
}

}  // namespace
