#include <cerrno>
#include <chrono>
#include <string>

#include "checker.h"
#include "env_check/peer.h"
#include "faults/failing_call.h"
#include "support/files.h"
#include "support/sandbox.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using TERN::HA::Daemon::GetRemoteHostname;
using TERN::HA::Daemon::Status;
using test::FakePeer;
using test::LogLine;
using test::PEER_ADDRESS;
using ::testing::ElementsAre;

namespace {

class HostnameTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        SandboxTest::SetUp();
        remoteIP(PEER_ADDRESS);
    }

    GetRemoteHostname getRemoteHostname;
    std::string hostname = "before";
};

TEST_F(HostnameTest, ReplyIsTakenByteForByte) {
    FakePeer peer(" Node-B\r\n\n");
    EXPECT_TRUE(getRemoteHostname(hostname));
    EXPECT_EQ(hostname, " Node-B\r\n\n");
    EXPECT_THAT(peer.requests(), ElementsAre("remote_hostname"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(HostnameTest, EmptyReplyIsAnEmptyName) {
    FakePeer peer("");
    EXPECT_TRUE(getRemoteHostname(hostname));
    EXPECT_EQ(hostname, "");
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(HostnameTest, LongNameIsTruncatedTo63Characters) {
    FakePeer peer(std::string(63, 'n') + "ode");
    EXPECT_TRUE(getRemoteHostname(hostname));
    EXPECT_EQ(hostname, std::string(63, 'n'));
}

TEST_F(HostnameTest, NoReplyIsLogged) {
    test::UdpSocket peer(PEER_ADDRESS, test::PEER_PORT);
    const test::Stopwatch watch;
    EXPECT_FALSE(getRemoteHostname(hostname));
    EXPECT_GE(watch.elapsed(), 3s);
    EXPECT_LT(watch.elapsed(), 20s);
    EXPECT_THAT(test::arrived(peer), ElementsAre("remote_hostname"));
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(LogLine("checker.cpp", "Failed to get remote hostname")));
}

TEST_F(HostnameTest, SocketFailureIsLoggedBeforeTheMissingReply) {
    FakePeer peer("node-b");
    {
        const test::FailingCall failing("socket", EMFILE);
        EXPECT_FALSE(getRemoteHostname(hostname));
    }
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(LogLine("env_check.cpp", "Failed to start socket client"),
                            LogLine("checker.cpp", "Failed to get remote hostname")));
}

TEST_F(HostnameTest, RepliesWithTheLocalHostnameUnchanged) {
    Status status;
    EXPECT_EQ(getRemoteHostname.handle(status), "");
    test::writeFile("/tmp/.ha.hostname.original", "node-a\n");
    EXPECT_EQ(getRemoteHostname.handle(status), "node-a\n");
    EXPECT_EQ(getRemoteHostname.getType(), "remote_hostname");
    EXPECT_EQ(test::bufferText(), "");
}

}  // namespace
