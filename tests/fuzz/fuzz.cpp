#include "fuzz/fuzz.h"

#include <fcntl.h>
#include <unistd.h>

#include <filesystem>

#include "support/sandbox_check.h"
#include "terncore.h"

namespace fuzz {

void prepareLog() {
    test::requireSandbox();
    std::filesystem::create_directories("/tmp/ha");
    std::filesystem::create_directories("/var/log/ha");
    for (const char* log : {"/tmp/ha/ha.daemon.log", "/tmp/ha/ha.daemon.record"}) {
        std::filesystem::remove(log);
        std::filesystem::create_symlink("/dev/null", log);
    }
}

void writeFile(const char* path, const std::string& content) {
    int file = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (file < 0) {
        std::filesystem::create_directories(std::filesystem::path(path).parent_path());
        file = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    }
    require(file >= 0 && write(file, content.data(), content.size()) == static_cast<ssize_t>(content.size()),
            "a fixture can be written");
    close(file);
}

namespace {

std::string output;

}  // namespace

void programsPrint(const std::string& text) {
    output = text;
}

}  // namespace fuzz

// Starting a program for each input would take most of the time. These functions interpose those of
// the platform library that start programs; the library reads a stream either way.

FILE* PLATPopenv(const char* /*path*/, const char* mode, const char* const* /*argv*/) {
    static char nothing[1] = {};
    return fuzz::output.empty() ? fmemopen(nothing, sizeof nothing, "w+")
                                : fmemopen(fuzz::output.data(), fuzz::output.size(), mode);
}

int PLATPclose(FILE* stream) {
    std::fclose(stream);
    return 0;
}
