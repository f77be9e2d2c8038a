#include "support/sandbox.h"

#include <sys/stat.h>
#include <syslog.h>

#include <algorithm>
#include <filesystem>

#include "support/files.h"
#include "support/pattern.h"
#include "support/sandbox_check.h"

namespace fs = std::filesystem;

namespace test {
namespace {

std::map<int, std::string> openDescriptors() {
    std::map<int, std::string> found;
    for (const auto& entry : fs::directory_iterator("/proc/self/fd")) {
        std::error_code gone;
        const std::string name = fs::read_symlink(entry.path(), gone);
        found[std::stoi(entry.path().filename())] = name;
    }
    // The listing's own descriptor is closed by now.
    for (auto entry = found.begin(); entry != found.end();) {
        entry = fs::exists(fs::symlink_status("/proc/self/fd/" + std::to_string(entry->first)))
                    ? std::next(entry)
                    : found.erase(entry);
    }
    return found;
}

void makePrivateDirectory(const std::string& path) {
    makeDirectories(path);
    ASSERT_EQ(chmod(path.c_str(), S_IRWXU), 0) << path;
}

std::string contentOrNothing(const std::string& path) {
    return exists(path) ? readFile(path) : std::string();
}

// The length of the time stamp at the start of a line with the blank after it; 0 when there is none.
size_t timeStampLength(const std::string& line) {
    static const Pattern kTimeStamp(
        "^[0-9]{4}-[0-9]{2}-[0-9]{2}T[0-9]{2}:[0-9]{2}:[0-9]{2}[+-][0-9]{2}:[0-9]{2} ");
    const std::vector<std::string> stamp = kTimeStamp.find(line);
    return stamp.empty() ? 0 : stamp.front().size();
}

}  // namespace

void SandboxTest::SetUp() {
    requireSandbox();
    makePrivateDirectory("/tmp/ha");
    makePrivateDirectory("/var/log/ha");
    descriptors_ = openDescriptors();
}

void SandboxTest::TearDown() {
    // The C library keeps its connection to the system log.
    closelog();
    for (const auto& [descriptor, name] : openDescriptors()) {
        const auto before = descriptors_.find(descriptor);
        if (before == descriptors_.end() || before->second != name) {
            ADD_FAILURE() << "descriptor " << descriptor << " was left open: " << name;
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
        const size_t length = timeStampLength(line);
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
        const size_t length = timeStampLength(line);
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
    static const Pattern kMessage("^([a-z_]+\\.cpp):([0-9]+) ");
    static const std::string kPlace = "%s:%d ";
    const std::vector<std::string> found = kMessage.find(message);
    if (found.empty()) {
        return false;
    }
    if (!exists(TERNHA_LIBRARY_SOURCES "/" + found.at(1))) {
        return true;
    }
    const std::vector<std::string> source = lines(readFile(TERNHA_LIBRARY_SOURCES "/" + found.at(1)));
    const size_t number = std::stoul(found.at(2));
    if (number < 1 || number > source.size()) {
        return false;
    }
    const std::string& line = source.at(number - 1);
    std::string literal = line.substr(std::min(line.find('"'), line.size() - 1) + 1);
    literal.erase(0, literal.compare(0, kPlace.size(), kPlace) == 0 ? kPlace.size() : 0);
    literal.erase(std::min(literal.find_first_of("\"%\\"), literal.size()));
    return !literal.empty() && message.compare(found.at(0).size(), literal.size(), literal) == 0;
}

}  // namespace test
