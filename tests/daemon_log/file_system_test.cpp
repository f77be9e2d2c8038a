#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <csignal>
#include <string>
#include <thread>

#include "daemon_log.h"
#include "support/files.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using TERN::HA::Daemon::DaemonLog;
using test::LOG;
using ::testing::ElementsAre;

// File systems that are full, read-only or missing for a while.
class LogFileSystemTest : public test::SandboxTest {
 protected:
    // Mount a tmpfs of 16 KiB over the directory.
    static void mountSmall(const char* directory) {
        ASSERT_EQ(mount("tmpfs", directory, "tmpfs", 0, "size=16k,mode=0700"), 0);
    }

    static void fill(const char* directory) {
        const std::string tooMuch(65536, 'x');
        EXPECT_ANY_THROW(test::writeFile(std::string(directory) + "/filler", tooMuch));
    }

    static void drain(const char* directory) { test::removeTree(std::string(directory) + "/filler"); }

    static void setReadOnly(const char* directory, bool isReadOnly) {
        const unsigned long readOnly = MS_RDONLY;
        ASSERT_EQ(mount("tmpfs", directory, "tmpfs", MS_REMOUNT | (isReadOnly ? readOnly : 0), "size=16k"),
                  0);
    }

    DaemonLog log{"/var/log/ha", "/ha.daemon.log"};
};

TEST_F(LogFileSystemTest, LineIsDroppedOnAFullBufferFileSystem) {
    mountSmall("/tmp/ha");
    fill("/tmp/ha");
    log.set("lost");
    EXPECT_EQ(test::bufferText(), "");
    drain("/tmp/ha");
    log.set("kept");
    EXPECT_THAT(test::daemonLogMessages(), ElementsAre("kept"));
}

TEST_F(LogFileSystemTest, LinesAreDroppedOnAFullLogFileSystem) {
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

TEST_F(LogFileSystemTest, LineIsDroppedOnAReadOnlyBufferFileSystem) {
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

TEST_F(LogFileSystemTest, LinesAreDroppedOnAReadOnlyLogFileSystem) {
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

TEST_F(LogFileSystemTest, RecoversWhenDirectoriesAreRecreated) {
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

std::atomic<bool> isInterrupted{false};

TEST_F(LogFileSystemTest, InterruptedWriteOfALineIsContinued) {
    // The line exceeds the capacity of the pipe: a signal interrupts its write halfway.
    ASSERT_EQ(mkfifo(test::BUFFER, 0600), 0);
    const int pipe = open(test::BUFFER, O_RDONLY | O_NONBLOCK | O_CLOEXEC);
    ASSERT_NE(pipe, -1);
    const int capacity = fcntl(pipe, F_GETPIPE_SZ);
    std::string text;
    for (int i = 0; static_cast<int>(text.size()) < 2 * capacity; ++i) {
        text += std::to_string(i) + ' ';
    }
    std::signal(SIGUSR2, [](int) { isInterrupted = true; });
    std::atomic<pid_t> id{0};
    std::thread writer([&] {
        id = gettid();
        log.set(text);
    });
    ASSERT_TRUE(test::eventually(10s, [&] {
        int filled = 0;
        return ioctl(pipe, FIONREAD, &filled) == 0 && filled == capacity && test::isAsleep(id);
    }));
    ASSERT_EQ(pthread_kill(writer.native_handle(), SIGUSR2), 0);
    ASSERT_TRUE(test::eventually(10s, [&] { return isInterrupted && test::isAsleep(id); }));
    ASSERT_EQ(fcntl(pipe, F_SETFL, 0), 0);
    std::string written;
    std::array<char, 4096> part;
    for (ssize_t count = 0; (count = read(pipe, part.data(), part.size())) > 0;) {
        written.append(part.data(), static_cast<std::size_t>(count));
    }
    writer.join();
    close(pipe);
    EXPECT_THAT(test::messages(written), ElementsAre(text));
}

TEST_F(LogFileSystemTest, RecoversWhenTheBufferIsNoLongerADirectory) {
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
