#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

namespace test {

/// A test with the log directories /tmp/ha and /var/log/ha (mode 0700). TearDown() fails the test
/// if a descriptor opened since SetUp() is still open: a fixture must close what it opened before
/// it calls this TearDown().
class SandboxTest : public ::testing::Test {
 protected:
    void SetUp() override;
    void TearDown() override;

 private:
    std::map<std::string, std::string> _descriptors;
};

/// Return whether the sandbox has users other than root: not if it was made by an ordinary user
/// without subordinate ids.
bool hasOtherUsers();

/// The daemon log and its buffer.
inline constexpr char LOG[] = "/var/log/ha/ha.daemon.log";
inline constexpr char BUFFER[] = "/tmp/ha/ha.daemon.log";

/// Return the buffer of the daemon log (record log), /tmp/ha/ha.daemon.log (.record); empty if
/// missing.
std::string bufferText();
std::string recordText();

/// Return the lines of a log without their time stamps, as in "checker.cpp:88 Failed to get
/// meminfo". A line without a time stamp such as "2026-11-15T09:23:41+01:00 " fails the test.
std::vector<std::string> messages(const std::string& logText);

/// Return the messages in the buffer of the daemon log.
std::vector<std::string> daemonLogMessages();

/// Return the entries of the record log's buffer without their time stamps. An entry extends to the
/// next line with a time stamp, without its final newline. Text before the first time stamp fails
/// the test.
std::vector<std::string> recordEntries();

/// Return whether `message` begins with a call site, as in "checker.cpp:88 Failed to get meminfo".
bool hasCallSite(const std::string& message);

/// Matches exactly FILE + ":" + a decimal number + " " + MESSAGE.
MATCHER_P2(LogLine, file, message,
           std::string(negation ? "is not" : "is") + " \"" + file + ":<number> " + message + "\"") {
    const std::string& line = arg;
    const std::string start = std::string(file) + ":";
    const std::size_t blank = line.find(' ');
    return hasCallSite(line) && line.compare(0, start.size(), start) == 0 &&
           line.substr(blank + 1) == message;
}

}  // namespace test
