#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <syslog.h>

#include <optional>
#include <string>
#include <vector>

#include "support/sandbox.h"
#include "support/system_log.h"

namespace test {

// A test that collects the system log of local sockets, which holds only errors.
class SocketTest : public SandboxTest {
 protected:
    void SetUp() override {
        SandboxTest::SetUp();
        _systemLog.emplace();
        openlog("socket-test", LOG_NDELAY, LOG_USER);
    }

    void TearDown() override {
        EXPECT_THAT(_systemLog->texts(), ::testing::Each(::testing::Truly(hasCallSite)));
        EXPECT_THAT(_systemLog->entries(),
                    ::testing::Each(::testing::Field(&SystemLog::Entry::priority, LOG_USER | LOG_ERR)));
        closelog();
        _systemLog.reset();
        SandboxTest::TearDown();
    }

    std::vector<std::string> systemLog() { return _systemLog->texts(); }

 private:
    std::optional<SystemLog> _systemLog;
};

}  // namespace test
