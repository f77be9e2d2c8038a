#include "support/sandbox.h"

#include <sys/stat.h>
#include <syslog.h>

#include <filesystem>
#include <regex>
#include <sstream>

#include "support/files.h"

namespace fs = std::filesystem;

namespace test {
namespace {

// Return the target of each open descriptor, without that of the listing itself.
std::map<std::string, std::string> openDescriptors() {
    std::vector<fs::path> paths;
    for (const auto& entry : fs::directory_iterator("/proc/self/fd")) {
        paths.push_back(entry.path());
    }
    std::map<std::string, std::string> found;
    for (const fs::path& path : paths) {
        std::error_code isGone;
        const fs::path target = fs::read_symlink(path, isGone);
        if (!isGone) {
            found[path.filename()] = target;
        }
    }
    return found;
}

std::string contentOrNothing(const std::string& path) {
    return exists(path) ? readFile(path) : std::string();
}

// Return the length of the time stamp and blank at the start of a line; 0 without one.
std::size_t timeStampLength(const std::string& line) {
    static const std::regex STAMP("^\\d{4}-\\d\\d-\\d\\dT\\d\\d:\\d\\d:\\d\\d[+-]\\d\\d:\\d\\d ");
    const std::string start = line.substr(0, sizeof "2026-11-15T09:23:41+01:00 " - 1);
    return std::regex_match(start, STAMP) ? start.size() : 0;
}

}  // namespace

bool hasOtherUsers() {
    std::istringstream map(readFile("/proc/self/uid_map"));
    unsigned long first = 0;
    unsigned long outside = 0;
    unsigned long count = 0;
    unsigned long sum = 0;
    while (map >> first >> outside >> count) {
        sum += count;
    }
    return sum > 1;
}

void SandboxTest::SetUp() {
    for (const char* directory : {"/tmp/ha", "/var/log/ha"}) {
        makeDirectories(directory);
        ASSERT_EQ(chmod(directory, S_IRWXU), 0) << directory;
    }
    _descriptors = openDescriptors();
}

void SandboxTest::TearDown() {
    // The C library keeps its connection to the system log open.
    closelog();
    for (const auto& [descriptor, target] : openDescriptors()) {
        const auto before = _descriptors.find(descriptor);
        if (before == _descriptors.end() || before->second != target) {
            ADD_FAILURE() << "descriptor " << descriptor << " was left open: " << target;
        }
    }
}

std::string bufferText() {
    return contentOrNothing("/tmp/ha/ha.daemon.log");
}

std::string recordText() {
    return contentOrNothing("/tmp/ha/ha.daemon.record");
}

std::vector<std::string> messages(const std::string& logText) {
    std::vector<std::string> found;
    for (const std::string& line : lines(logText)) {
        const std::size_t length = timeStampLength(line);
        EXPECT_NE(length, 0U) << "no time stamp at the start of the line: " << line;
        found.push_back(line.substr(length));
    }
    return found;
}

std::vector<std::string> daemonLogMessages() {
    return messages(bufferText());
}

std::vector<std::string> recordEntries() {
    std::vector<std::string> entries;
    for (const std::string& line : lines(recordText())) {
        const std::size_t length = timeStampLength(line);
        if (length != 0) {
            entries.push_back(line.substr(length));
        } else if (entries.empty()) {
            ADD_FAILURE() << "no time stamp at the start of the record: " << line;
        } else {
            entries.back() += "\n" + line;
        }
    }
    return entries;
}

bool hasCallSite(const std::string& message) {
    static const std::regex PLACE("^[a-z_]+\\.cpp:\\d+$");
    return message.find(' ') != std::string::npos &&
           std::regex_match(message.substr(0, message.find(' ')), PLACE);
}

}  // namespace test
