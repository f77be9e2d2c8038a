#include "journal.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

namespace ternhad {

namespace {

// systemd sets JOURNAL_STREAM to the DEVICE:INODE of standard error.
bool isJournal() {
    const char* const stream = std::getenv("JOURNAL_STREAM");
    struct stat info = {};
    return stream != nullptr && fstat(STDERR_FILENO, &info) == 0 &&
           std::to_string(info.st_dev) + ':' + std::to_string(info.st_ino) == stream;
}

}  // namespace

void writeJournal(Level level, const std::string& text) {
    const std::string prefix =
        isJournal() ? '<' + std::to_string(static_cast<int>(level)) + '>' : "ternhad: ";
    const std::string line = prefix + text + '\n';
    // Write in one piece; ignore errors, which have nowhere to go.
    [[maybe_unused]] const ssize_t written = write(STDERR_FILENO, line.data(), line.size());
}

}  // namespace ternhad
