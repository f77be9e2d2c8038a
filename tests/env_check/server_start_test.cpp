// The first pass of a server, and servers that fail to start.

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
using test::LogLine;
using test::PEER_PORT;
using test::SERVER;
using test::UdpSocket;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

// No SandboxTest, which would report the server socket, open until the process ends, as a leak.
class ServerStartTest : public ::testing::Test {
 protected:
    void SetUp() override { test::makeDirectories("/tmp/ha"); }

    // Every pass of a failed server logs `line` and returns early, whatever errno is by then.
    void expectFailure(const std::string& line) {
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
    localIP(SERVER);
    EXPECT_FALSE(isBound(SERVER, PEER_PORT));
    EXPECT_FALSE(isBound("0.0.0.0", PEER_PORT));
}

TEST_F(ServerStartTest, MissingLocalAddressListensOnAllAddresses) {
    ASSERT_EQ(localIP(""), "");
    auto pass = std::async(std::launch::async, [this] { return server(status); });
    ASSERT_TRUE(test::eventually(10s, [] { return isBound("0.0.0.0", PEER_PORT); }));
    UdpSocket client;
    client.send("is_alive", "127.0.0.77", PEER_PORT);
    EXPECT_TRUE(pass.get());
    EXPECT_EQ(test::receiveTimeout(), 30s);
    EXPECT_THAT(arrived(client), ElementsAre("alive"));
}

TEST_F(ServerStartTest, PortInUseFailsForGood) {
    UdpSocket owner(SERVER, PEER_PORT);
    localIP(SERVER);
    expectFailure("Failed to start socket serverAddress already in use");

    owner = UdpSocket();
    ASSERT_FALSE(isBound(SERVER, PEER_PORT));
    EXPECT_FALSE(server(status));
    EXPECT_FALSE(isBound(SERVER, PEER_PORT));
}

TEST_F(ServerStartTest, ForeignAddressFailsForGood) {
    localIP("192.0.2.1");
    expectFailure("Failed to start socket serverCannot assign requested address");
    localIP(SERVER);
    EXPECT_FALSE(server(status));
}

TEST_F(ServerStartTest, SocketFailureIsLoggedToBothLogs) {
    test::SystemLog systemLog;
    localIP(SERVER);
    {
        const test::FailingCall failing("socket", EMFILE);
        EXPECT_FALSE(server(status));
    }
    test::writeFile("/tmp/ha/ha.daemon.log", "");
    expectFailure("Failed to start socket serverToo many open files");
    EXPECT_THAT(systemLog.texts(), ElementsAre(LogLine("chkstate.cpp", "Failed to set socket")));
}

TEST_F(ServerStartTest, TimeoutOptionFailureFailsForGood) {
    test::SystemLog systemLog;
    localIP(SERVER);
    const test::FailingCall failing("setsockopt", EDOM);
    expectFailure("Failed to start socket serverNumerical argument out of domain");
    EXPECT_FALSE(isBound(SERVER, PEER_PORT));
    EXPECT_THAT(systemLog.texts(), IsEmpty());
}

}  // namespace
