#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mount.h>

#include "daemon_log.h"
#include "support/files.h"
#include "support/sandbox.h"

namespace {

using TERN::HA::Daemon::DaemonLog;
using test::LOG;
using ::testing::ElementsAre;

// File systems that take nothing any more, for a while.
class LogTroubleTest : public test::SandboxTest {
 protected:
    // Puts a file system of a few pages in the directory's place.
    static void mountSmall(const char* directory) {
        ASSERT_EQ(mount("tmpfs", directory, "tmpfs", 0, "size=16k,mode=0700"), 0);
    }

    static void fill(const char* directory) {
        try {
            test::writeFile(std::string(directory) + "/filler", std::string(65536, 'x'));
        } catch (const std::exception&) {
            // As far as it goes.
        }
    }

    static void drain(const char* directory) { test::removeTree(std::string(directory) + "/filler"); }

    static void setReadOnly(const char* directory, bool isReadOnly) {
        const unsigned long readOnly = MS_RDONLY;
        ASSERT_EQ(mount("tmpfs", directory, "tmpfs", MS_REMOUNT | (isReadOnly ? readOnly : 0), "size=16k"),
                  0);
    }

    DaemonLog log{"/var/log/ha", "/ha.daemon.log"};
};

TEST_F(LogTroubleTest, ALineIsDroppedWhileTheBuffersFileSystemIsFull) {
    mountSmall("/tmp/ha");
    fill("/tmp/ha");
    log.set("lost");
    EXPECT_EQ(test::bufferText(), "");
    drain("/tmp/ha");
    log.set("kept");
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre("kept"));
}

TEST_F(LogTroubleTest, LinesAreDroppedWhileTheLogsFileSystemIsFull) {
    mountSmall("/var/log/ha");
    fill("/var/log/ha");
    log.set("lost");
    log.writeLogToDisk();
    EXPECT_EQ(test::bufferText(), "");
    EXPECT_EQ(test::readFile(LOG), "");
    drain("/var/log/ha");
    log.set("kept");
    log.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile(LOG)), ElementsAre("kept"));
}

TEST_F(LogTroubleTest, ALineIsDroppedWhileTheBuffersFileSystemIsReadOnly) {
    mountSmall("/tmp/ha");
    log.set("before");
    setReadOnly("/tmp/ha", true);
    log.set("lost");
    log.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile(LOG)), ElementsAre("before"));
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre("before"));  // which cannot be emptied
    setReadOnly("/tmp/ha", false);
    log.set("after");
    log.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile(LOG)), ElementsAre("before", "before", "after"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(LogTroubleTest, LinesAreDroppedWhileTheLogsFileSystemIsReadOnly) {
    mountSmall("/var/log/ha");
    setReadOnly("/var/log/ha", true);
    log.set("lost");
    log.writeLogToDisk();
    log.rotate();
    EXPECT_EQ(test::bufferText(), "");
    EXPECT_FALSE(test::exists(LOG));
    setReadOnly("/var/log/ha", false);
    log.set("kept");
    log.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile(LOG)), ElementsAre("kept"));
}

TEST_F(LogTroubleTest, WorksAgainWhenTheDirectoriesAreMadeAgain) {
    for (const char* directory : {"/tmp/ha", "/var/log/ha"}) {
        test::removeTree(directory);
    }
    log.set("lost");
    log.writeLogToDisk();
    log.rotate();
    for (const char* directory : {"/tmp/ha", "/var/log/ha"}) {
        EXPECT_FALSE(test::exists(directory)) << "made by whoever owns them";
        test::makeDirectories(directory);
    }
    log.set("kept");
    log.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile(LOG)), ElementsAre("kept"));
}

TEST_F(LogTroubleTest, ADirectoryInTheBuffersPlaceCostsTheLinesOfThatTime) {
    test::makeDirectories("/tmp/ha/ha.daemon.log");
    log.set("lost");
    log.writeLogToDisk();
    EXPECT_EQ(test::readFile(LOG), "");
    test::removeTree("/tmp/ha/ha.daemon.log");
    log.set("kept");
    log.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile(LOG)), ElementsAre("kept"));
}

}  // namespace
