#include "journal.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

namespace ternhad {

namespace {

// systemd names what it connected standard error to as DEVICE:INODE.
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
    // In one piece; without a reader there is nobody to tell.
    [[maybe_unused]] const ssize_t written = write(STDERR_FILENO, line.data(), line.size());
}

}  // namespace ternhad
