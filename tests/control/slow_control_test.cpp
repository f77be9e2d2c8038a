#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "control.h"
#include "env_check.h"
#include "socket/local_sockets.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using namespace TERN::HA::Daemon;

class SlowControlTest : public test::SandboxTest {};

TEST_F(SlowControlTest, RebootTakes33SecondsWhileOtherClientsTimeOut) {
    remoteIP("127.0.0.2");  // no peer replies
    Status status;
    status.setRemoteAlive(true);
    MonitordSocket server(test::LOCAL_SOCKET, 0);
    server.setStatus(&status);
    ASSERT_TRUE(server.serverBind());
    const test::ServingThread serving(server);

    std::thread impatient([&status] {
        EXPECT_TRUE(test::eventually(20s, [&status] { return status.isRemoteRebooting(); }));
        const test::Stopwatch stopwatch;
        EXPECT_FALSE(MonitordSocket(test::LOCAL_SOCKET, 5).isRebootRemote());
        EXPECT_GE(stopwatch.elapsed(), 5s);
    });
    const test::Stopwatch stopwatch;
    EXPECT_TRUE(MonitordSocket(test::LOCAL_SOCKET, 60).rebootRemote());
    EXPECT_GE(stopwatch.elapsed(), 33s);
    EXPECT_LT(stopwatch.elapsed(), 55s);
    impatient.join();

    // A reply to a client that has timed out is dropped.
    EXPECT_EQ(test::exchange(R"({"act":"r"})"), R"({"is_froce_reboot_remote":true})");
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive | NodeRebooting);
    EXPECT_THAT(
        test::daemonLogMessages(),
        ::testing::ElementsAre(test::LogLine("status.cpp", "Remote server status changed to alive"),
                               test::LogLine("checker.cpp", "Failed to reboot remote, but keep checking")));
}

}  // namespace
