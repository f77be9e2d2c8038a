#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

namespace test {

/// A test with the directories of the log in place (/tmp/ha and /var/log/ha, mode 0700). After it, every
/// descriptor that was opened since SetUp() must be closed again: a fixture that opens something in its own
/// SetUp() closes it before it calls this TearDown().
class SandboxTest : public ::testing::Test {
 protected:
    void SetUp() override;
    void TearDown() override;

 private:
    std::map<std::string, std::string> _descriptors;
};

/// Where the daemon log's lines go, and where they are buffered until they are moved there.
inline constexpr char LOG[] = "/var/log/ha/ha.daemon.log";
inline constexpr char BUFFER[] = "/tmp/ha/ha.daemon.log";

/// The content of the buffer file of the daemon log (the record log), /tmp/ha/ha.daemon.log (.record); empty
/// when there is none.
std::string bufferText();
std::string recordText();

/// The lines of a log's text without their time stamps, as in "checker.cpp:88 Failed to get meminfo". A line
/// that does not begin with a time stamp such as "2026-11-15T09:23:41+01:00 " fails the test.
std::vector<std::string> messages(const std::string& logText);

/// The messages in the daemon log's buffer file.
std::vector<std::string> daemonLogMessages();

/// The entries of the record log's buffer file without their time stamps. An entry reaches to the next line
/// that begins with a time stamp; the line end that closes the entry is not part of it. Text before the first
/// time stamp fails the test.
std::vector<std::string> recordEntries();

/// True when `message` begins with the place that logged it, as in "checker.cpp:88 Failed to get meminfo".
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
