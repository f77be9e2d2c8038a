#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <optional>

#include "support/udp.h"
#include "ternhad/daemon.h"
#include "ternhad/manager.h"
#include "ternhad/played_peer.h"

namespace {

using namespace std::chrono_literals;

class WatchedDaemonTest : public ::testing::Test {
 protected:
    // Starts the daemon, which is to show its progress once in `interval`.
    test::Process start(std::chrono::microseconds interval) {
        setenv("WATCHDOG_USEC", std::to_string(interval.count()).c_str(), 1);
        unsetenv("WATCHDOG_PID");
        return test::Process(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo"));
    }

    bool hears(const std::string& state, std::chrono::milliseconds limit = 20s) {
        return test::eventually(limit, [&] { return manager.told() == state; });
    }

    test::ServiceManager manager;
};

TEST_F(WatchedDaemonTest, ReportsReadinessAndStop) {
    test::Process daemon = start(1h);
    EXPECT_TRUE(hears("READY=1")) << daemon.error();
    daemon.signal(SIGTERM);
    EXPECT_TRUE(hears("STOPPING=1"));
    EXPECT_TRUE(daemon.waitFor(10s).has_value());
    EXPECT_THAT(manager.told(), ::testing::AnyOf("", ::testing::StartsWith("STATUS=")));
}

TEST_F(WatchedDaemonTest, ReportsTheStateAsStatusLine) {
    test::writeFile("/sys/block/md0/md/sync_action", "resync\n");
    test::Process daemon = start(1h);
    std::string status;
    EXPECT_TRUE(test::eventually(20s, [&] {
        const std::string told = manager.told();
        status = told.rfind("STATUS=", 0) == 0 ? told : status;
        return status.find("peer dead since 20") != std::string::npos;
    })) << status;
    EXPECT_THAT(status, ::testing::EndsWith(", not-connected, resync"));
    daemon.signal(SIGTERM);
    EXPECT_TRUE(daemon.waitFor(10s).has_value());
}

TEST_F(WatchedDaemonTest, ReportsAnUnsupportedDrbdByItsVersion) {
    test::writeFile("/proc/drbd", "version: 9.1.7 (api:2/proto:110-121)\n");
    test::Process daemon = start(1h);
    std::string status;
    const std::string end = ", DRBD 9.1.7 is not supported";
    const auto isTold = [&] {
        const std::string told = manager.told();
        status = told.rfind("STATUS=", 0) == 0 ? told : status;
        return status.find(end) != std::string::npos;
    };
    EXPECT_TRUE(test::eventually(20s, isTold)) << status;
    EXPECT_EQ(status.find("connected"), std::string::npos) << status;
    const std::string journal = daemon.error();
    EXPECT_NE(journal.find("DRBD 9.1.7 is not supported, 8.4 is\n"), std::string::npos) << journal;
    EXPECT_EQ(journal.find("connected"), std::string::npos) << journal;
    daemon.signal(SIGTERM);
    EXPECT_TRUE(daemon.waitFor(10s).has_value());
}

TEST_F(WatchedDaemonTest, ReportsADeadPeersLastKnownStateAsStatusLine) {
    const auto isTold = [this](const std::string& begin, const std::string& end) {
        return test::eventually(20s, [&, told = manager.told()]() mutable {
            for (; !told.empty(); told = manager.told()) {
                if (told.rfind(begin, 0) == 0 && told.size() >= end.size() &&
                    told.compare(told.size() - end.size(), end.size(), end) == 0) {
                    return true;
                }
            }
            told = manager.told();
            return false;
        });
    };
    std::optional<test::PlayedPeer> peer(std::in_place);
    peer->setReply("is_md_resync", "resync");
    test::Process daemon = start(1h);
    EXPECT_TRUE(isTold("STATUS=peer alive since 20", ", peer-resync, not-connected"));
    peer.reset();
    EXPECT_TRUE(isTold("STATUS=peer dead since 20", ", not-connected; last known: peer-resync"));
}

TEST_F(WatchedDaemonTest, KeepsTheWatchdogQuiet) {
    test::Process daemon = start(4s);
    ASSERT_TRUE(hears("READY=1")) << daemon.error();
    // The pass that serves the peer ends with a question, or after 30 seconds.
    test::UdpSocket peer("127.0.0.2", 40000);
    for (int i = 0; i < 2; ++i) {
        EXPECT_TRUE(test::eventually(20s, [&] {
            peer.send("is_alive", "127.0.0.1", 7499);
            return manager.told() == "WATCHDOG=1";
        }));
    }
    daemon.signal(SIGTERM);
    EXPECT_TRUE(daemon.waitFor(10s).has_value());
}

TEST_F(WatchedDaemonTest, LetsTheWatchdogExpireWhileAThreadHangs) {
    test::writeFile("/proc/drbd", "");
    test::removeTree("/proc/drbd");
    ASSERT_EQ(mkfifo("/proc/drbd", 0600), 0);  // nobody writes: opening it waits
    test::Process daemon = start(2s);
    ASSERT_TRUE(hears("READY=1")) << daemon.error();
    test::UdpSocket peer("127.0.0.2", 40000);
    const test::Stopwatch stopwatch;
    EXPECT_FALSE(test::eventually(5s, [&] {
        peer.send("is_alive", "127.0.0.1", 7499);
        return manager.told() == "WATCHDOG=1";
    }));
    EXPECT_GE(stopwatch.elapsed(), 5s);
    daemon.signal(SIGTERM);
    EXPECT_TRUE(daemon.waitFor(10s).has_value());
}

}  // namespace
