#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "checker.h"
#include "support/files.h"
#include "support/sandbox.h"

namespace {

using TERN::HA::Daemon::isMDResync;
using TERN::HA::Daemon::isSysfsValue;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class MdTest : public test::SandboxTest {
 protected:
    static void setAction(const std::string& array, const std::string& text) {
        test::writeFile("/sys/block/" + array + "/md/sync_action", text);
    }
};

TEST_F(MdTest, MissingArraysAreLoggedOnEveryCall) {
    test::makeDirectories("/sys/block/sda");
    setAction("xmd0", "resync\n");  // only names that begin so count
    EXPECT_FALSE(isMDResync());
    EXPECT_FALSE(isMDResync());
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to set globBuf from /sys/block/md*"),
                            test::LogLine("checker.cpp", "Failed to set globBuf from /sys/block/md*")));
}

TEST_F(MdTest, ResyncOfAnyArrayCounts) {
    setAction("md0", "idle\n");
    setAction("md1", "resync\n");
    EXPECT_TRUE(isMDResync());
    setAction("md0", "resync\n");
    setAction("md1", "idle\n");
    EXPECT_TRUE(isMDResync());
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

class OtherActionTest : public MdTest, public ::testing::WithParamInterface<const char*> {};

TEST_P(OtherActionTest, IsNoResync) {
    setAction("md0", GetParam());
    EXPECT_FALSE(isMDResync());
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(Actions, OtherActionTest,
                         ::testing::Values("idle\n", "recover\n", "check\n", "repair\n", "reshape\n",
                                           "frozen\n", "resync \n", "resync\r\n", " resync\n", "Resync\n",
                                           "resyncing\n", "resyn\n", "", "\nresync\n", "idle\nresync\n"));

TEST_F(MdTest, OnlyFirstLineCounts) {
    setAction("md0", "resync");
    EXPECT_TRUE(isMDResync());
    setAction("md0", "resync\nidle\n");
    EXPECT_TRUE(isMDResync());
}

TEST_F(MdTest, ArrayWithoutSyncActionIsSkipped) {
    test::makeDirectories("/sys/block/md0");
    setAction("md1", "resync\n");
    EXPECT_TRUE(isMDResync());
    EXPECT_THAT(
        test::daemonLogMessages(),
        ElementsAre(test::LogLine("checker.cpp", "Failed to open sysfs file /sys/block/md0/md/sync_action")));
}

TEST_F(MdTest, SearchStopsAtFirstResync) {
    setAction("md0", "resync\n");
    test::makeDirectories("/sys/block/md1");
    EXPECT_TRUE(isMDResync());
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(MdTest, AllArraysAreReadUntilOneResyncs) {
    test::makeDirectories("/sys/block/md10");
    test::makeDirectories("/sys/block/md2");
    setAction("md3", "idle\n");
    EXPECT_FALSE(isMDResync());
    EXPECT_THAT(
        test::daemonLogMessages(),
        ElementsAre(test::LogLine("checker.cpp", "Failed to open sysfs file /sys/block/md10/md/sync_action"),
                    test::LogLine("checker.cpp", "Failed to open sysfs file /sys/block/md2/md/sync_action")));
}

TEST_F(MdTest, SysfsValueIsTheWholeFirstLine) {
    const auto isValue = [](const std::string& text, const std::string& expected) {
        test::writeFile("/tmp/value", text);
        return isSysfsValue("/tmp/value", expected);
    };
    EXPECT_TRUE(isValue("1\n", "1"));
    EXPECT_TRUE(isValue("", ""));
    EXPECT_TRUE(isValue("\n", ""));
    EXPECT_FALSE(isValue("1\n", ""));
    EXPECT_FALSE(isValue("1\n", "1\n"));
    EXPECT_FALSE(isValue("", "1"));
    EXPECT_TRUE(isValue(std::string("a\0b\n", 4), std::string("a\0b", 3)));
    EXPECT_FALSE(isValue(std::string("a\0b\n", 4), "a"));
    EXPECT_TRUE(isValue(std::string(100000, 'x') + "\nmore", std::string(100000, 'x')));
    EXPECT_FALSE(isValue(std::string(100000, 'x'), std::string(99999, 'x')));
    EXPECT_FALSE(isValue(std::string(99999, 'x'), std::string(100000, 'x')));
    EXPECT_FALSE(isSysfsValue("/tmp", "1"));  // a directory opens and has no lines
    EXPECT_TRUE(isSysfsValue("/tmp", ""));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
    EXPECT_FALSE(isSysfsValue("/tmp/missing", ""));
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to open sysfs file /tmp/missing")));
}

}  // namespace
