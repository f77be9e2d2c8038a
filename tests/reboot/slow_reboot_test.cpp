#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "checker.h"
#include "support/files.h"
#include "support/sandbox.h"
#include "support/udp.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using namespace TERN::HA::Daemon;

TEST(SlowRebootTest, APeerThatIgnoresTheRequestCountsAsRebootingAfterThirtySeconds) {
    test::makeDirectories("/tmp/ha");
    remoteIP("127.0.0.2");
    test::UdpSocket peer("127.0.0.2", 7499);
    Status status;
    status.setRemoteAlive(true);
    std::thread answer([&peer] {
        if (const auto question = peer.receive(10s)) {
            peer.send("", question->address, question->port);
        }
    });
    const test::Stopwatch stopwatch;
    EXPECT_TRUE(RebootRemote()(status));
    EXPECT_GE(stopwatch.elapsed(), 30s);
    EXPECT_LT(stopwatch.elapsed(), 45s);
    answer.join();
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive | NodeRebooting);
    EXPECT_THAT(test::daemonLogMessages(),
                ::testing::ElementsAre(test::LogLine("status.cpp", "Remote server status changed to alive")));
}

}  // namespace
