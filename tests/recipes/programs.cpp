#include "recipes/programs.h"

#include <sys/mount.h>

#include <cerrno>
#include <filesystem>
#include <regex>
#include <stdexcept>
#include <system_error>

#include "support/files.h"

namespace fs = std::filesystem;

namespace test {

namespace {

// Overlay the directories of the programs on those of the machine, writably.
void layOver(const fs::path& directory) {
    const fs::path layer = "/run/layers" + directory.string();
    makeDirectories(layer / "upper");
    makeDirectories(layer / "work");
    std::string lower = directory;
    if (fs::exists(RECIPES_ROOT + directory.string())) {
        lower = RECIPES_ROOT + lower + ':' + lower;
    }
    const std::string options = "lowerdir=" + lower + ",upperdir=" + (layer / "upper").string() +
                                ",workdir=" + (layer / "work").string();
    if (mount("overlay", directory.c_str(), "overlay", 0, options.c_str()) != 0) {
        throw std::system_error(errno, std::generic_category(), "cannot lay over " + directory.string());
    }
}

}  // namespace

void installPrograms() {
    for (const auto& entry : fs::directory_iterator("/usr")) {
        if (entry.is_directory() && !entry.is_symlink()) {
            layOver(entry.path());
        }
    }
    fs::copy_file(TERNHAD, "/usr/sbin/ternhad");
    fs::copy_file(TERNHACTL, "/usr/sbin/ternhactl");
}

std::string recipe(const std::string& path) {
    const std::string document = readFile(PROJECT_DIR "/docs/recipes.md");
    std::size_t begin = document.find("\n`" + path + "`");
    begin = begin == std::string::npos ? begin : document.find("\n```", begin);
    if (begin == std::string::npos) {
        throw std::runtime_error("docs/recipes.md shows no " + path);
    }
    begin = document.find('\n', begin + 1) + 1;
    return document.substr(begin, document.find("```", begin) - begin);
}

}  // namespace test
