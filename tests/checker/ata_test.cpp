#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>

#include "checker.h"
#include "support/files.h"
#include "support/json.h"
#include "support/sandbox.h"

namespace {

using TERN::HA::Daemon::isDiskErrHandling;
using test::parsed;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class AtaTest : public test::SandboxTest {
 protected:
    static void addPort(const std::string& port, const std::string& errorHandling) {
        test::writeFile("/sys/class/ata_port/" + port + "/error_handling", errorHandling);
    }

    static void addDisk(const std::string& port, const std::string& device) {
        const std::string path =
            "/sys/devices/pci0000:00/0000:00:1f.2/" + port + "/host2/target2:0:0/2:0:0:0/block/" + device;
        test::makeDirectories(path);
        std::filesystem::create_symlink(".." + path.substr(4), "/sys/block/" + device);
    }

    Json::Value disks{"unchanged"};
};

TEST_F(AtaTest, NoPortsLeaveTheListUnchanged) {
    test::writeFile("/sys/class/ata_port/xata1/error_handling", "1\n");  // only names that begin so count
    EXPECT_FALSE(isDiskErrHandling(disks));
    EXPECT_EQ(disks, "unchanged");
    EXPECT_THAT(
        test::daemonLogMessages(),
        ElementsAre(test::LogLine("checker.cpp", "Failed to set globBuf from /sys/class/ata_port/ata*")));
}

TEST_F(AtaTest, NoErrorHandlingYieldsAnEmptyList) {
    addPort("ata1", "0\n");
    addDisk("ata1", "sda");
    EXPECT_FALSE(isDiskErrHandling(disks));
    EXPECT_EQ(disks, Json::Value(Json::arrayValue));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(AtaTest, DisksUnderErrorHandlingAreListedInPathOrder) {
    addPort("ata2", "1\n");
    addDisk("ata2", "sda");
    addPort("ata10", "1\n");
    addDisk("ata10", "sdc");
    addPort("ata3", "0\n");
    addDisk("ata3", "sdb");
    EXPECT_TRUE(isDiskErrHandling(disks));
    EXPECT_EQ(disks, parsed(R"(["sdc","sda"])"));  // ata10 sorts before ata2
}

class ErrorHandlingTest : public AtaTest,
                          public ::testing::WithParamInterface<std::pair<const char*, bool>> {};

TEST_P(ErrorHandlingTest, OnlyFirstLineEqualToOneCounts) {
    addPort("ata1", GetParam().first);
    addDisk("ata1", "sda");
    EXPECT_EQ(isDiskErrHandling(disks), GetParam().second);
}

INSTANTIATE_TEST_SUITE_P(Values, ErrorHandlingTest,
                         ::testing::Values(std::pair("1\n", true), std::pair("1", true),
                                           std::pair("1\n0\n", true), std::pair("0\n", false),
                                           std::pair("0\n1\n", false), std::pair("1 \n", false),
                                           std::pair("11\n", false), std::pair("", false)));

TEST_F(AtaTest, PortWithoutDiskNameIsIgnored) {
    addPort("ata1", "1\n");
    addPort("ata2", "1\n");
    addDisk("ata2", "sda");
    EXPECT_TRUE(isDiskErrHandling(disks));
    EXPECT_EQ(disks, parsed(R"(["sda"])"));
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp",
                                          "Failed to get dev name by ata path: /sys/class/ata_port/ata1")));
}

TEST_F(AtaTest, TooLongDiskNameCountsAsNone) {
    addPort("ata1", "1\n");
    addDisk("ata1", "sdabcdef");
    EXPECT_FALSE(isDiskErrHandling(disks));
    EXPECT_EQ(disks, Json::Value(Json::arrayValue));
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp",
                                          "Failed to get dev name by ata path: /sys/class/ata_port/ata1")));
}

TEST_F(AtaTest, PortWithoutErrorHandlingFileIsSkipped) {
    test::makeDirectories("/sys/class/ata_port/ata1");
    addPort("ata2", "1\n");
    addDisk("ata2", "sda");
    EXPECT_TRUE(isDiskErrHandling(disks));
    EXPECT_EQ(disks, parsed(R"(["sda"])"));
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine(
                    "checker.cpp", "Failed to open sysfs file /sys/class/ata_port/ata1/error_handling")));
}

}  // namespace
