#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "checker.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using TERN::HA::Daemon::heartbeatLatency;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class HeartbeatTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        remoteIP("127.0.0.2");
    }
};

constexpr char SUMMARY[] = "echo 'rtt min/avg/max/mdev = 0.101/0.150/0.200/0.040 ms'\n";

TEST_F(HeartbeatTest, RealPingMeasuresAReachablePeer) {
    const float latency = heartbeatLatency();
    EXPECT_GT(latency, 0.0F);
    EXPECT_LT(latency, 1000.0F);
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(HeartbeatTest, RealPingFailsWithoutARoute) {
    remoteIP("10.9.8.7");  // no route: ping says so at once
    EXPECT_EQ(heartbeatLatency(), 0.0F);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec /bin/ping return code: 512")));
}

TEST_F(HeartbeatTest, PingSendsThreeProbesWithinTenSeconds) {
    test::replaceProgram("/bin/ping", "printf '%s\\n' \"$0\" \"$@\" > /tmp/arguments");
    heartbeatLatency();
    EXPECT_EQ(test::readFile("/tmp/arguments"), "/bin/ping\n127.0.0.2\n-c\n3\n-w\n10\n-i\n0.2\n-q\n");
}

TEST_F(HeartbeatTest, ResultIsTheAverageRoundTripTime) {
    test::replaceProgram(
        "/bin/ping", std::string("echo 'PING 127.0.0.2'; echo; echo '3 packets transmitted'\n") + SUMMARY);
    EXPECT_FLOAT_EQ(heartbeatLatency(), 0.15F);
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(HeartbeatTest, TotalPacketLossLogsTheExitStatus) {
    test::replaceProgram("/bin/ping", "echo '3 packets transmitted, 0 received, 100% packet loss'; exit 1");
    EXPECT_EQ(heartbeatLatency(), 0.0F);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec /bin/ping return code: 256")));
}

TEST_F(HeartbeatTest, AverageCountsEvenWhenPingFails) {
    test::replaceProgram("/bin/ping", std::string(SUMMARY) + "exit 1");
    EXPECT_FLOAT_EQ(heartbeatLatency(), 0.15F);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec /bin/ping return code: 256")));
}

TEST_F(HeartbeatTest, MissingSummaryIsNotLogged) {
    test::replaceProgram("/bin/ping", "echo nothing of use");
    EXPECT_EQ(heartbeatLatency(), 0.0F);
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(HeartbeatTest, OnlyFirstSummaryCounts) {
    test::replaceProgram("/bin/ping", std::string(SUMMARY) + "echo 'rtt min/avg/max/mdev = 9/9/9/9 ms'");
    EXPECT_FLOAT_EQ(heartbeatLatency(), 0.15F);
}

TEST_F(HeartbeatTest, ReadingStopsAtTheSummary) {
    // Exceeds the capacity of a pipe: SIGPIPE ends ping.
    test::replaceProgram("/bin/ping", std::string(SUMMARY) + "exec /usr/bin/head -c 200000 /dev/zero");
    EXPECT_FLOAT_EQ(heartbeatLatency(), 0.15F);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec /bin/ping return code: 13")));
}

TEST_F(HeartbeatTest, PingStartFailureLogsTwoLines) {
    test::hideProgram("/bin/ping");
    EXPECT_EQ(heartbeatLatency(), 0.0F);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec command: /bin/ping"),
                            test::LogLine("checker.cpp", "Failed to exec ifconfig to get interface status")));
}

TEST_F(HeartbeatTest, LongLineIsReadInChunksOf511Bytes) {
    // The summary begins with the second chunk.
    test::replaceProgram("/bin/ping", "printf '%0511d' 0\n" + std::string(SUMMARY));
    EXPECT_FLOAT_EQ(heartbeatLatency(), 0.15F);
    test::replaceProgram("/bin/ping", "printf '%0510d' 0\n" + std::string(SUMMARY));
    EXPECT_EQ(heartbeatLatency(), 0.0F);
}

}  // namespace
