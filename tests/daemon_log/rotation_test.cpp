#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "daemon_log.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"

namespace {

using TERN::HA::Daemon::DaemonLog;
using test::LOG;
using ::testing::ElementsAre;

std::string archive(int number) {
    return std::string(LOG) + "." + std::to_string(number);
}

void compress(const std::string& path, const std::string& content) {
    test::writeFile(path, content);
    ASSERT_EQ(test::run({"/bin/xz", path}).exitCode, 0);
}

std::string uncompressed(const std::string& path) {
    const auto xz = test::run({"/bin/xz", "--decompress", "--stdout", path});
    EXPECT_EQ(xz.exitCode, 0) << xz.error;
    return xz.output;
}

class RotationTest : public test::SandboxTest {
 protected:
    DaemonLog log{"/var/log/ha", "/ha.daemon.log"};
};

TEST_F(RotationTest, LogBecomesArchive0) {
    test::writeFile(LOG, "lines\n");
    log.rotate();
    EXPECT_FALSE(test::exists(LOG));
    EXPECT_FALSE(test::exists(std::string(LOG) + ".xz"));
    EXPECT_EQ(uncompressed(archive(0) + ".xz"), "lines\n");
}

TEST_F(RotationTest, StepsReturnTrueOnFailure) {
    test::writeFile("/tmp/a", "lines\n");
    EXPECT_FALSE(log._xz("/tmp/a"));
    EXPECT_TRUE(log._xz("/tmp/a"));
    EXPECT_FALSE(log._rename("/tmp/a.xz", "/tmp/b.xz"));
    EXPECT_TRUE(log._rename("/tmp/a.xz", "/tmp/b.xz"));
    EXPECT_EQ(uncompressed("/tmp/b.xz"), "lines\n");
}

TEST_F(RotationTest, OldestOfFortyArchivesIsDropped) {
    for (int number = 0; number < 40; ++number) {
        compress(archive(number), std::to_string(number));
    }
    test::writeFile(LOG, "log");
    log.rotate();
    EXPECT_FALSE(test::exists(LOG));
    EXPECT_EQ(uncompressed(archive(0) + ".xz"), "log");
    for (int number = 1; number < 40; ++number) {
        EXPECT_EQ(uncompressed(archive(number) + ".xz"), std::to_string(number - 1));
    }
    EXPECT_FALSE(test::exists(archive(40) + ".xz"));
}

TEST_F(RotationTest, GapBetweenArchivesMovesUp) {
    compress(archive(0), "zero");
    compress(archive(2), "two");
    test::writeFile(LOG, "log");
    log.rotate();
    EXPECT_EQ(uncompressed(archive(0) + ".xz"), "log");
    EXPECT_EQ(uncompressed(archive(1) + ".xz"), "zero");
    EXPECT_FALSE(test::exists(archive(2) + ".xz"));
    EXPECT_EQ(uncompressed(archive(3) + ".xz"), "two");
}

TEST_F(RotationTest, ArchivesMoveUpWithoutALog) {
    compress(archive(0), "zero");
    log.rotate();
    EXPECT_FALSE(test::exists(archive(0) + ".xz"));
    EXPECT_EQ(uncompressed(archive(1) + ".xz"), "zero");
}

TEST_F(RotationTest, UncompressedArchiveIsCompressed) {
    test::writeFile(archive(5), "five");
    log.rotate();
    EXPECT_FALSE(test::exists(archive(5)));
    EXPECT_FALSE(test::exists(archive(5) + ".xz"));
    EXPECT_EQ(uncompressed(archive(6) + ".xz"), "five");
}

TEST_F(RotationTest, UncompressedOldestArchiveIsReplaced) {
    compress(archive(38), "thirty-eight");
    test::writeFile(archive(39), "thirty-nine");
    log.rotate();
    EXPECT_FALSE(test::exists(archive(39)));
    EXPECT_EQ(uncompressed(archive(39) + ".xz"), "thirty-eight");
}

TEST_F(RotationTest, ExistingCompressedLogDelaysCompression) {
    test::writeFile(LOG, "new");
    compress(std::string(LOG) + ".copy", "old");
    ASSERT_EQ(test::run({"mv", std::string(LOG) + ".copy.xz", std::string(LOG) + ".xz"}).exitCode, 0);
    log.rotate();
    EXPECT_EQ(test::readFile(LOG), "new");
    EXPECT_EQ(uncompressed(archive(0) + ".xz"), "old");
    log.rotate();
    EXPECT_FALSE(test::exists(LOG));
    EXPECT_EQ(uncompressed(archive(0) + ".xz"), "new");
    EXPECT_EQ(uncompressed(archive(1) + ".xz"), "old");
}

TEST_F(RotationTest, ExistingCompressedArchiveDelaysCompression) {
    compress(archive(5), "compressed");
    test::writeFile(archive(5), "uncompressed");
    log.rotate();
    EXPECT_EQ(test::readFile(archive(5)), "uncompressed");
    EXPECT_EQ(uncompressed(archive(6) + ".xz"), "compressed");
    log.rotate();
    EXPECT_FALSE(test::exists(archive(5)));
    EXPECT_EQ(uncompressed(archive(6) + ".xz"), "uncompressed");
    EXPECT_EQ(uncompressed(archive(7) + ".xz"), "compressed");
}

TEST_F(RotationTest, FailedCompressionKeepsTheLog) {
    test::writeFile(LOG, "lines\n");
    test::hideProgram("/bin/xz");
    log.rotate();
    EXPECT_EQ(test::readFile(LOG), "lines\n");
    test::restoreProgram("/bin/xz");
    log.rotate();
    EXPECT_EQ(uncompressed(archive(0) + ".xz"), "lines\n");
}

TEST_F(RotationTest, OtherLogIsNotRotated) {
    test::writeFile(LOG, "daemon");
    test::writeFile("/var/log/ha/ha.daemon.record", "record");
    log.rotate();
    EXPECT_EQ(test::readFile("/var/log/ha/ha.daemon.record"), "record");
    EXPECT_FALSE(test::exists("/var/log/ha/ha.daemon.record.0.xz"));
}

TEST_F(RotationTest, NextMoveCreatesANewLog) {
    log.set("first");
    log.writeLogToDisk();
    log.rotate();
    log.set("second");
    log.writeLogToDisk();
    EXPECT_THAT(test::messages(test::readFile(LOG)), ElementsAre("second"));
}

TEST_F(RotationTest, SizeIsThatOfTheLogOnDisk) {
    EXPECT_EQ(log.size(), 0);
    test::writeFile("/tmp/ha/ha.daemon.log", "buffered lines do not count");
    EXPECT_EQ(log.size(), 0);
    test::writeFile(LOG, std::string(12345, 'x'));
    EXPECT_EQ(log.size(), 12345);
    test::removeTree("/var/log/ha");
    EXPECT_EQ(log.size(), 0);
}

TEST_F(RotationTest, SizeMayExceed32Bits) {
    constexpr std::int64_t FIVE_GIB = std::int64_t{5} << 30;
    test::writeFile(LOG, "");
    ASSERT_EQ(truncate(LOG, FIVE_GIB), 0);
    EXPECT_EQ(log.size(), FIVE_GIB);
}

}  // namespace
