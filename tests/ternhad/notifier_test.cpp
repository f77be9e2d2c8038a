#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>

#include "service_notifier.h"
#include "ternhad/manager.h"

namespace {

using namespace std::chrono_literals;

class ServiceNotifierTest : public ::testing::Test {
 protected:
    std::string told() { return manager.told(); }

    test::ServiceManager manager;
};

TEST_F(ServiceNotifierTest, ReportsEachState) {
    ternhad::notifyReady();
    EXPECT_EQ(told(), "READY=1");
    ternhad::notifyAlive();
    EXPECT_EQ(told(), "WATCHDOG=1");
    ternhad::notifyAlive();
    EXPECT_EQ(told(), "WATCHDOG=1");
    ternhad::notifyStatus("peer alive");
    EXPECT_EQ(told(), "STATUS=peer alive");
    ternhad::notifyStopping();
    EXPECT_EQ(told(), "STOPPING=1");
}

TEST_F(ServiceNotifierTest, IsSilentWithoutASupervisor) {
    unsetenv("NOTIFY_SOCKET");
    ternhad::notifyReady();
    ternhad::notifyAlive();
    ternhad::notifyStatus("peer alive");
    ternhad::notifyStopping();
    EXPECT_EQ(told(), "");
}

TEST_F(ServiceNotifierTest, ReadsTheWatchdogInterval) {
    setenv("WATCHDOG_USEC", "120000000", 1);
    setenv("WATCHDOG_PID", std::to_string(getpid()).c_str(), 1);
    EXPECT_EQ(ternhad::watchdogInterval(), std::chrono::microseconds(2min));
    EXPECT_EQ(ternhad::watchdogInterval(), std::chrono::microseconds(2min));
}

TEST_F(ServiceNotifierTest, IgnoresTheWatchdogOfAnotherProcess) {
    EXPECT_EQ(ternhad::watchdogInterval(), std::nullopt);
    setenv("WATCHDOG_USEC", "120000000", 1);
    setenv("WATCHDOG_PID", std::to_string(getpid() + 1).c_str(), 1);
    EXPECT_EQ(ternhad::watchdogInterval(), std::nullopt);
}

}  // namespace
