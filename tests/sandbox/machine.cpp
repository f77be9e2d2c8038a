#include "machine.h"

#include <glob.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace fs = std::filesystem;

namespace sandbox {
namespace {

constexpr const char* kWatchedPaths[] = {"/tmp/ha",
                                         "/var/log/ha",
                                         "/run/ternha",
                                         "/tmp/.ha.hostname.original",
                                         "/tmp/info*",
                                         "/usr/tern",
                                         "/var/packages/FailoverPair"};
constexpr unsigned long kPeerPort = 7499;

void addFile(const std::string& path, MachineState& state) {
    struct stat status = {};
    if (lstat(path.c_str(), &status) != 0) {
        return;
    }
    std::ostringstream line;
    line << path << " (mode " << std::oct << status.st_mode << std::dec << ", " << status.st_size
         << " bytes, changed " << status.st_mtim.tv_sec << "." << status.st_mtim.tv_nsec << ")";
    state.insert(line.str());
}

// Files may come and go while others use the machine; what has gone meanwhile is passed over.
void addTree(const std::string& path, MachineState& state) {
    addFile(path, state);
    std::error_code error;
    if (fs::is_symlink(path, error) || !fs::is_directory(path, error)) {
        return;
    }
    fs::recursive_directory_iterator entry(path, fs::directory_options::skip_permission_denied, error);
    while (!error && entry != fs::recursive_directory_iterator()) {
        addFile(entry->path(), state);
        entry.increment(error);
    }
}

void addPaths(MachineState& state) {
    for (const char* pattern : kWatchedPaths) {
        glob_t found{};
        if (glob(pattern, 0, nullptr, &found) == 0) {
            for (size_t i = 0; i < found.gl_pathc; ++i) {
                addTree(found.gl_pathv[i], state);
            }
        }
        globfree(&found);
    }
}

// Columns: slot, local address:port in hexadecimal, remote address, ..., the inode is the tenth.
void addUdpSockets(const char* table, MachineState& state) {
    std::ifstream file(table);
    std::string line;
    std::getline(file, line);
    while (std::getline(file, line)) {
        std::istringstream columns(line);
        std::string slot;
        std::string local;
        std::string skipped;
        std::string inode;
        columns >> slot >> local;
        for (int i = 0; i < 7; ++i) {
            columns >> skipped;
        }
        columns >> inode;
        const size_t colon = local.rfind(':');
        if (colon != std::string::npos && std::stoul(local.substr(colon + 1), nullptr, 16) == kPeerPort) {
            state.insert("UDP socket " + local + " (inode " + inode + ")");
        }
    }
}

void addUnixSockets(MachineState& state) {
    std::ifstream file("/proc/net/unix");
    std::string line;
    while (std::getline(file, line)) {
        const size_t path = line.find_first_of("/@");
        if (path != std::string::npos && line.find("/ternha/", path) != std::string::npos) {
            state.insert("Unix socket " + line.substr(path));
        }
    }
}

}  // namespace

MachineState observeMachine() {
    MachineState state;
    addPaths(state);
    addUdpSockets("/proc/net/udp", state);
    addUdpSockets("/proc/net/udp6", state);
    addUnixSockets(state);
    return state;
}

std::vector<std::string> differences(const MachineState& before, const MachineState& after) {
    std::vector<std::string> lines;
    for (const std::string& line : after) {
        if (before.count(line) == 0) {
            lines.push_back("+ " + line);
        }
    }
    for (const std::string& line : before) {
        if (after.count(line) == 0) {
            lines.push_back("- " + line);
        }
    }
    return lines;
}

}  // namespace sandbox
