// The peer checks end to end, between two nodes with separate networks, files and processes.

#include <chrono>
#include <string>

#include "checker.h"
#include "env_check/peer.h"
#include "support/files.h"
#include "support/node.h"
#include "support/sandbox.h"
#include "support/wait.h"

using namespace std::chrono_literals;
using TERN::HA::Daemon::GetRemoteHostname;
using TERN::HA::Daemon::IsRemoteAlive;
using TERN::HA::Daemon::Status;

namespace {

constexpr const char* ADDRESS_A = "10.0.0.1";
constexpr const char* ADDRESS_B = "10.0.0.2";
constexpr const char* BUFFER = "/tmp/ha/ha.daemon.log";

class TwoNodesTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        SandboxTest::SetUp();
        test::connect(a, ADDRESS_A, b, ADDRESS_B);
        test::makeDirectories(a.path("/tmp/ha"));
        test::makeDirectories(b.path("/tmp/ha"));
        remoteIP(ADDRESS_B);
    }

    // Run the server on node B until the process is killed or a pass fails.
    test::Process serveOnB() {
        test::Process process = b.start([] {
            localIP(ADDRESS_B);
            Status status;
            SocketServer server;
            while (server(status)) {
            }
            return 1;
        });
        const std::string table = "/.kernel/proc/" + std::to_string(b.pid()) + "/net/udp";
        EXPECT_TRUE(test::eventually(10s, [&] { return test::isBound(ADDRESS_B, test::PEER_PORT, table); }));
        return process;
    }

    int onA(const std::function<void()>& function) {
        return a.call([&] {
            function();
            return 0;
        });
    }

    test::Node a{"node-a"};
    test::Node b{"node-b"};
};

TEST_F(TwoNodesTest, PeerIsAliveWhileItsServerRuns) {
    {
        const test::Process server = serveOnB();
        EXPECT_EQ(onA([] { EXPECT_TRUE(IsRemoteAlive()()); }), 0);
        EXPECT_EQ(onA([] { EXPECT_TRUE(IsRemoteAlive()()); }), 0);
    }
    EXPECT_EQ(onA([] { EXPECT_FALSE(IsRemoteAlive()()); }), 0);
    EXPECT_FALSE(test::exists(a.path(BUFFER)));
    EXPECT_FALSE(test::exists(b.path(BUFFER)));
}

TEST_F(TwoNodesTest, PeerIsNotAliveWhileTheLinkIsDown) {
    const test::Process server = serveOnB();
    test::setLink(b, false);
    EXPECT_EQ(onA([] { EXPECT_FALSE(IsRemoteAlive()()); }), 0);
    test::setLink(b, true);
    EXPECT_TRUE(test::eventually(30s, [this] { return onA([] { EXPECT_TRUE(IsRemoteAlive()()); }) == 0; }));
}

TEST_F(TwoNodesTest, PeerHostnameKeepsItsNewline) {
    test::writeFile(a.path("/tmp/.ha.hostname.original"), "node-a\n");
    test::writeFile(b.path("/tmp/.ha.hostname.original"), "node-b\n");
    const test::Process server = serveOnB();
    EXPECT_EQ(onA([] {
                  std::string hostname;
                  EXPECT_TRUE(GetRemoteHostname()(hostname));
                  EXPECT_EQ(hostname, "node-b\n");
              }),
              0);
    EXPECT_FALSE(test::exists(a.path(BUFFER)));
    EXPECT_FALSE(test::exists(b.path(BUFFER)));
}

TEST_F(TwoNodesTest, PeerWithoutAHostnameRepliesWithAnEmptyOne) {
    const test::Process server = serveOnB();
    EXPECT_EQ(onA([] {
                  std::string hostname = "before";
                  EXPECT_TRUE(GetRemoteHostname()(hostname));
                  EXPECT_EQ(hostname, "");
              }),
              0);
}

}  // namespace
