// Both checks from end to end: two nodes, each with a network, files and processes of its own.

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

constexpr const char* kAddressA = "10.0.0.1";
constexpr const char* kAddressB = "10.0.0.2";
constexpr const char* kLog = "/tmp/ha/ha.daemon.log";

class TwoNodesTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        SandboxTest::SetUp();
        test::connect(a, kAddressA, b, kAddressB);
        test::makeDirectories(a.path("/tmp/ha"));
        test::makeDirectories(b.path("/tmp/ha"));
        remoteIP(kAddressB);
    }

    // Serves on node B until the process is killed or a pass fails.
    test::Process serveOnB() {
        test::Process process = b.start([] {
            localIP(kAddressB);
            Status status;
            SocketServer server;
            while (server(status)) {
            }
            return 1;
        });
        const std::string table = "/.kernel/proc/" + std::to_string(b.pid()) + "/net/udp";
        EXPECT_TRUE(test::eventually(10s, [&] { return test::isBound(kAddressB, test::kPeerPort, table); }));
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

TEST_F(TwoNodesTest, APeerIsAliveWhileItsServerRuns) {
    {
        const test::Process server = serveOnB();
        EXPECT_EQ(onA([] { EXPECT_TRUE(IsRemoteAlive()()); }), 0);
        EXPECT_EQ(onA([] { EXPECT_TRUE(IsRemoteAlive()()); }), 0);
    }
    EXPECT_EQ(onA([] { EXPECT_FALSE(IsRemoteAlive()()); }), 0);
    EXPECT_FALSE(test::exists(a.path(kLog)));
    EXPECT_FALSE(test::exists(b.path(kLog)));
}

TEST_F(TwoNodesTest, APeerBehindACutLinkIsNotAlive) {
    const test::Process server = serveOnB();
    test::setLink(b, false);
    EXPECT_EQ(onA([] { EXPECT_FALSE(IsRemoteAlive()()); }), 0);
    test::setLink(b, true);
    EXPECT_TRUE(test::eventually(30s, [this] { return onA([] { EXPECT_TRUE(IsRemoteAlive()()); }) == 0; }));
}

TEST_F(TwoNodesTest, TheHostNameOfThePeerArrivesWithItsLineEnd) {
    test::writeFile(a.path("/tmp/.ha.hostname.original"), "node-a\n");
    test::writeFile(b.path("/tmp/.ha.hostname.original"), "node-b\n");
    const test::Process server = serveOnB();
    EXPECT_EQ(onA([] {
                  std::string hostname;
                  EXPECT_TRUE(GetRemoteHostname()(hostname));
                  EXPECT_EQ(hostname, "node-b\n");
              }),
              0);
    EXPECT_FALSE(test::exists(a.path(kLog)));
    EXPECT_FALSE(test::exists(b.path(kLog)));
}

TEST_F(TwoNodesTest, APeerWithoutAHostNameAnswersAnEmptyOne) {
    const test::Process server = serveOnB();
    EXPECT_EQ(onA([] {
                  std::string hostname = "before";
                  EXPECT_TRUE(GetRemoteHostname()(hostname));
                  EXPECT_EQ(hostname, "");
              }),
              0);
}

}  // namespace
