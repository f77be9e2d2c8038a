// The first pass of a server, and servers that could not start.

#include <cerrno>
#include <chrono>
#include <future>
#include <string>

#include "env_check.h"
#include "env_check/peer.h"
#include "faults/failing_call.h"
#include "status.h"
#include "support/files.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using TERN::HA::Daemon::Status;
using test::arrived;
using test::isBound;
using test::kPeerPort;
using test::kServer;
using test::LogLine;
using test::UdpSocket;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

// The socket of a server stays open until the process ends, and so these tests do not look at descriptors.
class ServerStartTest : public ::testing::Test {
 protected:
    void SetUp() override { test::makeDirectories("/tmp/ha"); }

    // Every pass of a broken server says `line`, at once and whatever the error number is by then.
    void expectBroken(const std::string& line) {
        const test::Stopwatch watch;
        EXPECT_FALSE(server(status));
        errno = ENOENT;
        EXPECT_FALSE(server(status));
        errno = 0;
        EXPECT_FALSE(SocketServer()(status));
        EXPECT_LT(watch.elapsed(), 20s);
        const auto expected = LogLine("env_check.cpp", line);
        EXPECT_THAT(test::daemonLogMessages(), ElementsAre(expected, expected, expected));
    }

    Status status;
    SocketServer server;
};

TEST_F(ServerStartTest, NothingIsBoundBeforeTheFirstPass) {
    localIP(kServer);
    EXPECT_FALSE(isBound(kServer, kPeerPort));
    EXPECT_FALSE(isBound("0.0.0.0", kPeerPort));
}

TEST_F(ServerStartTest, WithoutALocalAddressListensOnAllAddresses) {
    ASSERT_EQ(localIP(""), "");
    auto pass = std::async(std::launch::async, [this] { return server(status); });
    ASSERT_TRUE(test::eventually(10s, [] { return isBound("0.0.0.0", kPeerPort); }));
    UdpSocket asker;
    asker.send("is_alive", "127.0.0.77", kPeerPort);
    EXPECT_TRUE(pass.get());
    EXPECT_EQ(test::receiveTimeout(), 30s);
    EXPECT_THAT(arrived(asker), ElementsAre("alive"));
}

TEST_F(ServerStartTest, APortThatIsTakenBreaksTheServerForGood) {
    UdpSocket owner(kServer, kPeerPort);
    localIP(kServer);
    expectBroken("Failed to start socket serverAddress already in use");

    owner = UdpSocket();
    ASSERT_FALSE(isBound(kServer, kPeerPort));
    EXPECT_FALSE(server(status));
    EXPECT_FALSE(isBound(kServer, kPeerPort));
}

TEST_F(ServerStartTest, AnAddressOfAnotherHostBreaksTheServer) {
    localIP("192.0.2.1");
    expectBroken("Failed to start socket serverCannot assign requested address");
    localIP(kServer);
    EXPECT_FALSE(server(status));
}

TEST_F(ServerStartTest, NoSocketBreaksTheServerAndBothLogsSaySo) {
    test::SystemLog systemLog;
    localIP(kServer);
    {
        const test::FailingCall failing("socket", EMFILE);
        EXPECT_FALSE(server(status));
    }
    test::writeFile("/tmp/ha/ha.daemon.log", "");
    expectBroken("Failed to start socket serverToo many open files");
    EXPECT_THAT(systemLog.texts(), ElementsAre(LogLine("chkstate.cpp", "Failed to set socket")));
}

TEST_F(ServerStartTest, NoTimeoutBreaksTheServer) {
    test::SystemLog systemLog;
    localIP(kServer);
    const test::FailingCall failing("setsockopt", EDOM);
    expectBroken("Failed to start socket serverNumerical argument out of domain");
    EXPECT_FALSE(isBound(kServer, kPeerPort));
    EXPECT_THAT(systemLog.texts(), IsEmpty());
}

}  // namespace
