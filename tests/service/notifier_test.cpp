#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <cstring>

#include "service_notifier.h"
#include "support/descriptor.h"

namespace {

using namespace std::chrono_literals;

constexpr char ADDRESS[] = "/tmp/notify.sock";

class ServiceNotifierTest : public ::testing::Test {
 protected:
    ServiceNotifierTest() {
        sockaddr_un address = {};
        address.sun_family = AF_UNIX;
        std::strcpy(address.sun_path, ADDRESS);
        EXPECT_EQ(bind(manager_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
        setenv("NOTIFY_SOCKET", ADDRESS, 1);
    }

    // What the manager has been told since the last call, and nothing when it has not.
    std::string told() {
        std::array<char, 256> buffer = {};
        const ssize_t size = recv(manager_.get(), buffer.data(), buffer.size(), MSG_DONTWAIT);
        return size > 0 ? std::string(buffer.data(), static_cast<std::size_t>(size)) : std::string();
    }

 private:
    test::Descriptor manager_{socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0), "cannot make a socket"};
};

TEST_F(ServiceNotifierTest, TellsEachState) {
    ternhad::notifyReady();
    EXPECT_EQ(told(), "READY=1");
    ternhad::notifyAlive();
    EXPECT_EQ(told(), "WATCHDOG=1");
    ternhad::notifyAlive();
    EXPECT_EQ(told(), "WATCHDOG=1");
    ternhad::notifyStopping();
    EXPECT_EQ(told(), "STOPPING=1");
}

TEST_F(ServiceNotifierTest, IsSilentWithoutAManager) {
    unsetenv("NOTIFY_SOCKET");
    ternhad::notifyReady();
    ternhad::notifyAlive();
    ternhad::notifyStopping();
    EXPECT_EQ(told(), "");
}

TEST_F(ServiceNotifierTest, KnowsTheIntervalThatItsManagerWatches) {
    setenv("WATCHDOG_USEC", "120000000", 1);
    setenv("WATCHDOG_PID", std::to_string(getpid()).c_str(), 1);
    EXPECT_EQ(ternhad::watchdogInterval(), std::chrono::microseconds(2min));
    EXPECT_EQ(ternhad::watchdogInterval(), std::chrono::microseconds(2min));
}

TEST_F(ServiceNotifierTest, IsNotWatchedWhenAnotherProcessIs) {
    EXPECT_EQ(ternhad::watchdogInterval(), std::nullopt);
    setenv("WATCHDOG_USEC", "120000000", 1);
    setenv("WATCHDOG_PID", std::to_string(getpid() + 1).c_str(), 1);
    EXPECT_EQ(ternhad::watchdogInterval(), std::nullopt);
}

}  // namespace
