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
using test::PEER_ADDRESS;
using test::PEER_PORT;
using test::UdpSocket;
using ::testing::AllOf;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;

namespace {

class TestCheck : public EnvCheck {
 public:
    using EnvCheck::_sendToRemote;
    std::string getType() override { return "test_request"; }
};

class NamelessCheck : public EnvCheck {
 public:
    using EnvCheck::_sendToRemote;
};

class ExchangeTest : public test::SandboxTest {
 protected:
    void expectTimeout() {
        const test::Stopwatch watch;
        EXPECT_FALSE(check._sendToRemote(reply));
        EXPECT_GE(watch.elapsed(), 3s);
        EXPECT_EQ(reply, "before");
        EXPECT_EQ(test::bufferText(), "");
    }

    // Expect that nothing is sent and a line logged when `call` fails with `error`.
    void expectNothingSent(const char* call, int error) {
        UdpSocket peer(PEER_ADDRESS, PEER_PORT);
        remoteIP(PEER_ADDRESS);
        {
            const test::FailingCall failing(call, error);
            EXPECT_FALSE(check._sendToRemote(reply));
        }
        EXPECT_EQ(reply, "before");
        EXPECT_THAT(arrived(peer), IsEmpty());
        EXPECT_THAT(test::daemonLogMessages(),
                    ElementsAre(test::LogLine("env_check.cpp", "Failed to start socket client")));
    }

    TestCheck check;
    std::string reply = "before";
};

TEST_F(ExchangeTest, SendsTheTypeNameAndReturnsTheReply) {
    FakePeer peer("reply");
    remoteIP(PEER_ADDRESS);
    EXPECT_TRUE(check._sendToRemote(reply));
    EXPECT_EQ(reply, "reply");
    EXPECT_THAT(peer.requests(), ElementsAre("test_request"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(ExchangeTest, EmptyReplyIsAReply) {
    FakePeer peer("");
    remoteIP(PEER_ADDRESS);
    EXPECT_TRUE(check._sendToRemote(reply));
    EXPECT_EQ(reply, "");
}

TEST_F(ExchangeTest, ReplyIsTruncatedTo63Characters) {
    FakePeer peer(std::string(63, 'x') + "yyyyyyy");
    remoteIP(PEER_ADDRESS);
    EXPECT_TRUE(check._sendToRemote(reply));
    EXPECT_EQ(reply, std::string(63, 'x'));
}

TEST_F(ExchangeTest, ReplyEndsAtFirstZeroByte) {
    FakePeer peer("rep\0ly"s);
    remoteIP(PEER_ADDRESS);
    EXPECT_TRUE(check._sendToRemote(reply));
    EXPECT_EQ(reply, "rep");
}

TEST_F(ExchangeTest, CheckWithoutATypeNameSendsUndefine) {
    FakePeer peer("reply");
    remoteIP(PEER_ADDRESS);
    EXPECT_TRUE(NamelessCheck()._sendToRemote(reply));
    EXPECT_THAT(peer.requests(), ElementsAre("Undefine"));
}

TEST_F(ExchangeTest, SendsOneRequestAndTimesOutAfterThreeSeconds) {
    UdpSocket peer(PEER_ADDRESS, PEER_PORT);
    remoteIP(PEER_ADDRESS);
    expectTimeout();
    EXPECT_EQ(test::receiveTimeout(), 3s);
    EXPECT_THAT(arrived(peer), ElementsAre("test_request"));
}

TEST_F(ExchangeTest, MissingRemoteAddressCountsAs0000) {
    ASSERT_EQ(remoteIP(""), "");
    UdpSocket own("127.0.0.1", PEER_PORT);
    expectTimeout();
    EXPECT_THAT(arrived(own), ElementsAre("test_request"));
}

TEST_F(ExchangeTest, ClosedPeerPortTimesOut) {
    remoteIP(PEER_ADDRESS);
    expectTimeout();
}

TEST_F(ExchangeTest, SendFailureTimesOut) {
    remoteIP("255.255.255.255");
    expectTimeout();
}

TEST_F(ExchangeTest, SocketFailureIsLoggedAndNothingIsSent) {
    test::SystemLog systemLog;
    expectNothingSent("socket", EMFILE);
    EXPECT_THAT(systemLog.texts(), ElementsAre(test::LogLine("chkstate.cpp", "Failed to set socket")));
}

TEST_F(ExchangeTest, TimeoutOptionFailureIsLoggedAndNothingIsSent) {
    expectNothingSent("setsockopt", EDOM);
}

TEST_F(ExchangeTest, DatagramFromAnotherAddressIsTakenAsTheReply) {
    UdpSocket peer(PEER_ADDRESS, PEER_PORT);
    remoteIP(PEER_ADDRESS);
    std::thread other([&] {
        const auto asked = peer.receive(10s);
        if (asked) {
            UdpSocket("127.0.0.3").send("from another address", asked->address, asked->port);
        }
    });
    EXPECT_TRUE(check._sendToRemote(reply));
    other.join();
    EXPECT_EQ(reply, "from another address");
}

TEST_F(ExchangeTest, ConcurrentRequestsGetTheirReplies) {
    constexpr int THREADS = 8;
    constexpr int REQUESTS = 50;
    FakePeer peer("reply");
    remoteIP(PEER_ADDRESS);
    std::vector<std::vector<std::string>> replies(THREADS);
    std::vector<std::thread> threads;
    for (auto& own : replies) {
        threads.emplace_back([&own] {
            for (int i = 0; i < REQUESTS; ++i) {
                std::string received;
                own.push_back(TestCheck()._sendToRemote(received) ? received : "nothing");
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_THAT(replies, Each(AllOf(SizeIs(REQUESTS), Each("reply"))));
    EXPECT_THAT(peer.requests(), AllOf(SizeIs(THREADS * REQUESTS), Each("test_request")));
}

}  // namespace
