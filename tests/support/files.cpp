#include "support/files.h"

#include <filesystem>
#include <fstream>
#include <sstream>

#include "support/descriptor.h"

namespace fs = std::filesystem;

namespace test {
namespace {

void put(const std::string& path, const std::string& text, std::ios::openmode mode) {
    makeDirectories(fs::path(path).parent_path());
    std::ofstream file(path, std::ios::binary | mode);
    file << text << std::flush;
    check(file.good(), "cannot write " + path);
}

}  // namespace

void writeFile(const std::string& path, const std::string& text) {
    put(path, text, std::ios::trunc);
}

void appendFile(const std::string& path, const std::string& text) {
    put(path, text, std::ios::app);
}

std::string readFile(const std::string& path) {
    const std::ifstream file(path, std::ios::binary);
    check(file.good(), "cannot read " + path);
    std::ostringstream content;
    content << file.rdbuf();
    return content.str();
}

bool exists(const std::string& path) {
    return fs::exists(fs::symlink_status(path));
}

void makeDirectories(const std::string& path) {
    fs::create_directories(path);
}

void removeTree(const std::string& path) {
    fs::remove_all(path);
}

std::vector<std::string> lines(const std::string& text) {
    std::vector<std::string> found;
    std::istringstream stream(text);
    for (std::string line; std::getline(stream, line);) {
        found.push_back(line);
    }
    return found;
}

}  // namespace test
