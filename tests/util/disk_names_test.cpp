#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>

#include "support/files.h"
#include "support/sandbox.h"
#include "util.h"

namespace {

using TERN::HA::Daemon::Util::devListToHumanReadable;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr char TABLE[] = "/tmp/ha/info_hd.remote";

class DiskNamesTest : public test::SandboxTest {
 protected:
    static std::vector<std::string> names(const std::string& table, const std::vector<std::string>& devices) {
        test::writeFile(TABLE, table);
        return devListToHumanReadable(devices);
    }
};

constexpr char THREE_DISKS[] = R"({"1": {"HD_DEVNAME": "sda"}, "0-2": {"HD_DEVNAME": "sdb"},
    "1-3": {"HD_DEVNAME": "sdc", "HD_CONTAINER": "EXP1"}})";

TEST_F(DiskNamesTest, NamesHoldUnitSlotAndEnclosure) {
    EXPECT_THAT(names(THREE_DISKS, {"sda", "sdb", "sdc"}), ElementsAre("Disk 1", "disk 2", "disk 3(EXP1)"));
    EXPECT_THAT(names(THREE_DISKS, {"sdc", "sda"}), ElementsAre("disk 3(EXP1)", "Disk 1"));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(DiskNamesTest, DeviceWithoutAnEntryIsOmitted) {
    EXPECT_THAT(names(THREE_DISKS, {"sdz"}), IsEmpty());
    EXPECT_THAT(names(THREE_DISKS, {"sda", "SDA", "sd", "sdaa", "sdb"}), ElementsAre("Disk 1", "disk 2"));
    EXPECT_THAT(names(THREE_DISKS, {}), IsEmpty());
}

TEST_F(DiskNamesTest, MissingTableKeepsDeviceNames) {
    EXPECT_THAT(devListToHumanReadable({"sda", "sdb"}), ElementsAre("sda", "sdb"));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(DiskNamesTest, EmptyTableKeepsDeviceNames) {
    // A value other than an object has no members.
    for (const char* table : {"{}", "null", "[]", R"([{"HD_DEVNAME":"sda"}])", "7", R"("sda")", "true"}) {
        EXPECT_THAT(names(table, {"sda", "sdb"}), ElementsAre("sda", "sdb")) << table;
    }
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

class MalformedTableTest : public DiskNamesTest, public ::testing::WithParamInterface<std::string> {};

TEST_P(MalformedTableTest, IsLoggedAndKeepsDeviceNames) {
    EXPECT_THAT(names(GetParam(), {"sda", "sdb"}), ElementsAre("sda", "sdb"));
    EXPECT_THAT(
        test::daemonLogMessages(),
        ElementsAre(test::LogLine("util.cpp", "Failed to read HD info json: /tmp/ha/info_hd.remote")));
}

INSTANTIATE_TEST_SUITE_P(Tables, MalformedTableTest,
                         ::testing::Values("", "hello", "{\"1\":", std::string(100000, '['),
                                           "{\"1\":" + std::string(100000, '[')));

TEST_F(DiskNamesTest, DirectoryInPlaceOfTheTableIsLogged) {
    test::makeDirectories(TABLE);
    EXPECT_THAT(devListToHumanReadable({"sda"}), ElementsAre("sda"));
    EXPECT_THAT(
        test::daemonLogMessages(),
        ElementsAre(test::LogLine("util.cpp", "Failed to read HD info json: /tmp/ha/info_hd.remote")));
}

// Files that are not read.
class UnreadableTableTest : public DiskNamesTest {
 protected:
    static void expectUnreadable() {
        EXPECT_THAT(devListToHumanReadable({"sda"}), ElementsAre("sda"));
        EXPECT_THAT(
            test::daemonLogMessages(),
            ElementsAre(test::LogLine("util.cpp", "Failed to read HD info json: /tmp/ha/info_hd.remote")));
    }
};

TEST_F(UnreadableTableTest, FifoDoesNotBlock) {
    ASSERT_EQ(mkfifo(TABLE, 0600), 0);
    expectUnreadable();
}

TEST_F(UnreadableTableTest, FifoIsNotRead) {
    ASSERT_EQ(mkfifo(TABLE, 0600), 0);
    std::fstream writer(TABLE, std::ios::in | std::ios::out);
    writer << THREE_DISKS << std::flush;
    expectUnreadable();
}

TEST_F(UnreadableTableTest, SizeLimitIsOneMebibyte) {
    const std::string table = THREE_DISKS;
    EXPECT_THAT(names(table + std::string(1048576 - table.size(), ' '), {"sda"}), ElementsAre("Disk 1"));
    test::writeFile(TABLE, table + std::string(1048577 - table.size(), ' '));
    expectUnreadable();
}

TEST_F(DiskNamesTest, UnnamedEnclosureKeepsItsBrackets) {
    EXPECT_THAT(names(R"({"2-5":{"HD_DEVNAME":"sda"}})", {"sda"}), ElementsAre("disk 5()"));
    EXPECT_THAT(names(R"({"2-5":{"HD_DEVNAME":"sda","HD_CONTAINER":null}})", {"sda"}),
                ElementsAre("disk 5()"));
}

TEST_F(DiskNamesTest, KeyIsSplitAtItsFirstDash) {
    EXPECT_THAT(names(R"({"1-2-3":{"HD_DEVNAME":"sda","HD_CONTAINER":"E"}})", {"sda"}),
                ElementsAre("disk 2-3(E)"));
    EXPECT_THAT(names(R"({"0-":{"HD_DEVNAME":"sda"}})", {"sda"}), ElementsAre("disk "));
    EXPECT_THAT(names(R"({"-7":{"HD_DEVNAME":"sda","HD_CONTAINER":"E"}})", {"sda"}),
                ElementsAre("disk 7(E)"));
    EXPECT_THAT(names(R"({"00-7":{"HD_DEVNAME":"sda","HD_CONTAINER":"E"}})", {"sda"}),
                ElementsAre("disk 7(E)"));
    EXPECT_THAT(names(R"({"0-7":{"HD_DEVNAME":"sda","HD_CONTAINER":"E"}})", {"sda"}), ElementsAre("disk 7"));
    EXPECT_THAT(names(R"({"":{"HD_DEVNAME":"sda"}})", {"sda"}), ElementsAre("Disk "));
}

TEST_F(DiskNamesTest, DeviceListedTwiceHasBothNamesInKeyOrder) {
    EXPECT_THAT(names(R"({"3":{"HD_DEVNAME":"sda"},"10":{"HD_DEVNAME":"sda"}})", {"sda"}),
                ElementsAre("Disk 10", "Disk 3"));
}

TEST_F(DiskNamesTest, DeviceRequestedTwiceIsNamedTwice) {
    EXPECT_THAT(names(R"({"3":{"HD_DEVNAME":"sda"}})", {"sda", "sda"}), ElementsAre("Disk 3", "Disk 3"));
}

TEST_F(DiskNamesTest, MalformedEntriesAreSkipped) {
    EXPECT_THAT(
        names(R"({"1":7,"2":["sda"],"3":null,"4":"sda","5":{"HD_DEVNAME":["sda"]},"6":{"HD_DEVNAME":{}},
                          "7-1":{"HD_DEVNAME":"sda","HD_CONTAINER":["E"]},"8":{"HD_DEVNAME":"sda"}})",
              {"sda"}),
        ElementsAre("Disk 8"));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(DiskNamesTest, ValuesAreConvertedToStrings) {
    EXPECT_THAT(names(R"({"1":{"HD_DEVNAME":7},"2-3":{"HD_DEVNAME":true,"HD_CONTAINER":5}})", {"7", "true"}),
                ElementsAre("Disk 1", "disk 3(5)"));
}

TEST_F(DiskNamesTest, TableMayContainComments) {
    EXPECT_THAT(names("// disks\n{\"1\": /* first */ {\"HD_DEVNAME\": \"sda\"}}", {"sda"}),
                ElementsAre("Disk 1"));
}

TEST_F(DiskNamesTest, TableIsReadOnEveryCall) {
    EXPECT_THAT(names(R"({"1":{"HD_DEVNAME":"sda"}})", {"sda"}), ElementsAre("Disk 1"));
    EXPECT_THAT(names(R"({"2":{"HD_DEVNAME":"sda"}})", {"sda"}), ElementsAre("Disk 2"));
}

}  // namespace
