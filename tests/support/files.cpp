#include "support/files.h"

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <system_error>

#include "support/sandbox_check.h"

namespace fs = std::filesystem;

namespace test {
namespace {

[[noreturn]] void fail(const std::string& what) {
    throw std::system_error(errno, std::generic_category(), what);
}

void put(const std::string& path, const std::string& text, std::ios::openmode mode) {
    requireSandbox();
    fs::create_directories(fs::path(path).parent_path());
    std::ofstream file(path, std::ios::binary | mode);
    file << text;
    file.close();
    if (!file) {
        fail("cannot write " + path);
    }
}

}  // namespace

void writeFile(const std::string& path, const std::string& text) {
    put(path, text, std::ios::trunc);
}

void appendFile(const std::string& path, const std::string& text) {
    put(path, text, std::ios::app);
}

std::string readFile(const std::string& path) {
    requireSandbox();
    std::ifstream file(path, std::ios::binary);
    if (!file) {
        fail("cannot read " + path);
    }
    std::ostringstream content;
    content << file.rdbuf();
    return content.str();
}

bool exists(const std::string& path) {
    requireSandbox();
    return fs::exists(fs::symlink_status(path));
}

void makeDirectories(const std::string& path) {
    requireSandbox();
    fs::create_directories(path);
}

void removeTree(const std::string& path) {
    requireSandbox();
    fs::remove_all(path);
}

std::vector<std::string> lines(const std::string& text) {
    std::vector<std::string> found;
    std::istringstream stream(text);
    std::string line;
    while (std::getline(stream, line)) {
        found.push_back(line);
    }
    return found;
}

}  // namespace test
