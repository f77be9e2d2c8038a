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
    std::map<int, std::string> descriptors_;
};

/// The content of the daemon log's buffer file, /tmp/ha/ha.daemon.log; empty when there is none.
std::string bufferText();

/// The content of the record log's buffer file, /tmp/ha/ha.daemon.record; empty when there is none.
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

/// True when `message`, as in "checker.cpp:88 Failed to get meminfo", names the line of the library's source
/// that holds the beginning of its text, or a file that is not one of the library's.
bool hasCallSite(const std::string& message);

/// Matches exactly FILE + ":" + a decimal number + " " + MESSAGE; for a file of the library's, the number of
/// the line that logs it.
MATCHER_P2(LogLine, file, message,
           std::string(negation ? "is not" : "is") + " \"" + file + ":<number> " + message + "\"") {
    const std::string line = arg;
    const std::string start = std::string(file) + ":";
    const std::string end = std::string(" ") + message;
    if (line.size() <= start.size() + end.size() || line.compare(0, start.size(), start) != 0 ||
        line.compare(line.size() - end.size(), end.size(), end) != 0) {
        return false;
    }
    const std::string number = line.substr(start.size(), line.size() - start.size() - end.size());
    return number.find_first_not_of("0123456789") == std::string::npos && hasCallSite(line);
}

}  // namespace test
