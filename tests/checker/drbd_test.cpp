#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "checker.h"
#include "support/files.h"
#include "support/sandbox.h"

namespace {

using TERN::HA::Daemon::isDRBDConnect;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr char HEADER[] = "version: 8.4.11 (api:1/proto:86-101)\nsrcversion: 96ED19D4C144624490A9AB1\n";

class DrbdTest : public test::SandboxTest {
 protected:
    static bool isConnectedWith(const std::string& text) {
        test::writeFile("/proc/drbd", text);
        return isDRBDConnect();
    }
};

std::string resource(int number, const std::string& state) {
    return " " + std::to_string(number) + ": cs:" + state +
           " ro:Primary/Unknown ds:UpToDate/DUnknown C r-----\n    ns:0 nr:0 dw:0 dr:912 al:8 bm:0 lo:0 "
           "pe:0\n";
}

class ConnectedStateTest : public DrbdTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(ConnectedStateTest, CountsAsConnected) {
    EXPECT_TRUE(isConnectedWith(HEADER + resource(0, GetParam())));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(States, ConnectedStateTest,
                         ::testing::Values("WFReportParams", "Connected", "StartingSyncS", "StartingSyncT",
                                           "WFBitMapS", "WFBitMapT", "WFSyncUUID", "SyncSource", "SyncTarget",
                                           "PausedSyncS", "PausedSyncT", "VerifyS", "VerifyT"));

class OtherStateTest : public DrbdTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(OtherStateTest, CountsAsDisconnected) {
    EXPECT_FALSE(isConnectedWith(HEADER + resource(0, GetParam())));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(States, OtherStateTest,
                         ::testing::Values("StandAlone", "Disconnecting", "Unconnected", "Timeout",
                                           "BrokenPipe", "NetworkFailure", "ProtocolError", "TearDown",
                                           "WFConnection", "Ahead", "Behind", "connected", "CONNECTED",
                                           "Connecte", "WFReportParam", "StartingSync", "WFBitMap",
                                           "WFSyncUUI", "SyncSourc", "SyncTarge", "PausedSync", "Verify",
                                           "Con\nnected"));

TEST_F(DrbdTest, OneConnectedResourceSuffices) {
    EXPECT_TRUE(isConnectedWith(HEADER + resource(0, "StandAlone") + resource(1, "Connected")));
    EXPECT_TRUE(isConnectedWith(HEADER + resource(0, "SyncTarget") + resource(1, "WFConnection")));
    EXPECT_FALSE(isConnectedWith(HEADER + resource(0, "StandAlone") + resource(1, "WFConnection")));
}

TEST_F(DrbdTest, StateInsideALongerWordCounts) {
    EXPECT_TRUE(isConnectedWith("xxVerifySxx"));
    EXPECT_TRUE(isConnectedWith("no resource, but NotConnectedAtAll somewhere\n"));
}

TEST_F(DrbdTest, LongLinesAndZeroBytesAreSearched) {
    EXPECT_TRUE(isConnectedWith(std::string(1000000, 'x') + "Connected"));
    EXPECT_TRUE(isConnectedWith(std::string(4095, 'x') + "Connected\n"));
    EXPECT_TRUE(isConnectedWith(std::string("\0\0cs:Connected\0", 15)));
    EXPECT_FALSE(isConnectedWith(std::string(1000000, 'x')));
}

TEST_F(DrbdTest, EmptyFileMeansDisconnected) {
    EXPECT_FALSE(isConnectedWith(""));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(DrbdTest, FileIsReadOnEveryCall) {
    EXPECT_TRUE(isConnectedWith(resource(0, "Connected")));
    EXPECT_FALSE(isConnectedWith(resource(0, "StandAlone")));
    EXPECT_TRUE(isConnectedWith(resource(0, "Connected")));
}

TEST_F(DrbdTest, MissingModuleIsLoggedOnEveryCall) {
    EXPECT_FALSE(isDRBDConnect());
    EXPECT_FALSE(isDRBDConnect());
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to open /proc/drbd"),
                            test::LogLine("checker.cpp", "Failed to open /proc/drbd")));
}

}  // namespace
