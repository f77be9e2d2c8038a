#include "directories.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <iostream>

#include "ha_log.h"
#include "printable.h"

namespace ternhad {

namespace {

constexpr char BUFFER_DIR[] = "/tmp/ha";
constexpr char RUN_DIR[] = "/run/ternha";
constexpr mode_t PRIVATE_DIR = 0700;

bool complain(const std::string& path, const std::string& reason) {
    std::cerr << "ternhad: " << path << ": " << reason << '\n';
    return false;
}

std::filesystem::path directoryOf(const std::string& socket) {
    return std::filesystem::path(socket).lexically_normal().parent_path();
}

bool makeDirectory(const std::string& path, mode_t mode = PRIVATE_DIR) {
    std::error_code error;
    const std::filesystem::path parent = std::filesystem::path(path).parent_path();
    std::filesystem::create_directories(parent, error);
    if (error) {
        return complain(parent, error.message());
    }
    struct stat info = {};
    if (lstat(path.c_str(), &info) == 0) {
        return true;  // mkdir would block on a frozen disk even if it exists
    }
    if (mkdir(path.c_str(), mode) == 0) {
        chmod(path.c_str(), mode);  // whatever the umask is
    } else if (errno != EEXIST) {
        return complain(path, std::strerror(errno));
    }
    return true;
}

// Return whether no other user can write to the directory. Files that others left in it earlier
// could redirect writes to it.
bool isOurs(const char* path) {
    struct stat info = {};
    if (lstat(path, &info) != 0) {
        return complain(path, std::strerror(errno));
    }
    if (!S_ISDIR(info.st_mode)) {
        return complain(path, "not a directory");
    }
    if (info.st_uid != geteuid()) {
        return complain(path, "belongs to another user");
    }
    if ((info.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
        return complain(path, "others can write to it");
    }
    return true;
}

bool hasOnlyOurFiles(const char* path) {
    std::error_code error;
    for (const auto& entry : std::filesystem::directory_iterator(path, error)) {
        const std::string name = path + ("/" + printable(entry.path().filename()));
        struct stat info = {};
        if (lstat(entry.path().c_str(), &info) != 0) {
            continue;  // removed in the meantime
        }
        if (!S_ISREG(info.st_mode) && !S_ISDIR(info.st_mode)) {
            return complain(name, "neither a file nor a directory");
        }
        if (info.st_uid != geteuid()) {
            return complain(name, "belongs to another user");
        }
    }
    return !error || complain(path, error.message());
}

}  // namespace

mode_t socketDirectoryMode(const Options& options) {
    const bool isShared =
        !options.statusSocket.empty() && directoryOf(options.statusSocket) == directoryOf(options.socket);
    return isShared ? STATUS_DIRECTORY_MODE : PRIVATE_DIR;
}

void openStatusDirectory(const Options& options) {
    if (directoryOf(options.statusSocket) == RUN_DIR && chmod(RUN_DIR, STATUS_DIRECTORY_MODE) != 0) {
        complain(RUN_DIR, std::strerror(errno));
    }
}

bool prepareDirectories(const Options& options) {
    return makeDirectory(BUFFER_DIR) && isOurs(BUFFER_DIR) && hasOnlyOurFiles(BUFFER_DIR) &&
           makeDirectory(TERN::HA::Daemon::LOG_DIR) &&
           makeDirectory(directoryOf(options.socket), socketDirectoryMode(options));
}

}  // namespace ternhad
