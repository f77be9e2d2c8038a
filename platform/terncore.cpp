#include "terncore.h"

#include <dirent.h>
#include <fcntl.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <new>
#include <optional>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

namespace {

constexpr int FAILURE = -1;
constexpr int FIRST_PRIVATE_FD = 3;  // above standard input, output and error
constexpr int NOT_STARTED = 127;     // exit code, as shells use it

struct Closing {
    void operator()(FILE* file) const { (void)std::fclose(file); }
    void operator()(DIR* directory) const { (void)closedir(directory); }
};
using File = std::unique_ptr<FILE, Closing>;
using Directory = std::unique_ptr<DIR, Closing>;

// Programs behind open streams.
using Streams = std::map<FILE*, pid_t>;
std::mutex streamsMutex;
Streams& streams() {
    static auto* const map = new Streams;  // never freed: streams may be closed during exit
    return *map;
}

int waitForEnd(pid_t pid) {
    int status = 0;
    while (waitpid(pid, &status, 0) == -1) {
        if (errno != EINTR) {
            return FAILURE;
        }
    }
    return status;
}

bool exitedWithSuccess(int status) {
    return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// Emulators cannot report a failed exec: check the usual reasons beforehand.
int startError(const char* path) {
    struct stat info = {};
    if (stat(path, &info) != 0) {
        return errno;
    }
    if (!S_ISREG(info.st_mode)) {
        return EACCES;
    }
    return faccessat(AT_FDCWD, path, X_OK, AT_EACCESS) == 0 ? 0 : errno;
}

// Start a program with default signals, nothing blocked and no descriptor above standard error.
// `fd`, unless negative, becomes its descriptor `target`. Returns 0 or the error number.
int start(pid_t* pid, const char* path, const char* const argv[], int fd, int target) {
    if (path == nullptr || argv == nullptr || argv[0] == nullptr) {
        return EINVAL;
    }
    if (const int error = startError(path); error != 0) {
        return error;
    }
    sigset_t none;
    sigset_t all;
    sigemptyset(&none);
    sigfillset(&all);

    posix_spawnattr_t attributes = {};
    posix_spawnattr_init(&attributes);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
    posix_spawnattr_setsigmask(&attributes, &none);
    posix_spawnattr_setsigdefault(&attributes, &all);

    posix_spawn_file_actions_t actions = {};
    posix_spawn_file_actions_init(&actions);
    int error = fd < 0 ? 0 : posix_spawn_file_actions_adddup2(&actions, fd, target);
    if (error == 0) {
        error = posix_spawn_file_actions_addclosefrom_np(&actions, FIRST_PRIVATE_FD);
    }
    if (error == 0) {
        error = posix_spawn(pid, path, &actions, &attributes, const_cast<char* const*>(argv), environ);
    }
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attributes);
    return error;
}

// Run a program without waiting: an intermediate process starts it and exits, so that init reaps
// the program. Signals are blocked in that process, which is a copy of the caller.
int startDetached(const char* path, const char* const argv[]) {
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before);
    const pid_t intermediate = fork();
    if (intermediate == 0) {
        pid_t pid = 0;
        _exit(start(&pid, path, argv, -1, -1) == 0 ? 0 : NOT_STARTED);
    }
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return intermediate != -1 && exitedWithSuccess(waitForEnd(intermediate)) ? 0 : FAILURE;
}

// Return the text of a file, or nothing when it cannot be read.
std::optional<std::string> textOf(const std::string& path) {
    const File file(std::fopen(path.c_str(), "re"));
    if (!file) {
        return std::nullopt;
    }
    std::string text;
    std::string block(4096, '\0');
    while (std::feof(file.get()) == 0 && std::ferror(file.get()) == 0) {
        text.append(block, 0, std::fread(block.data(), 1, block.size(), file.get()));
    }
    return std::ferror(file.get()) == 0 ? std::optional(text) : std::nullopt;
}

std::string trimmed(const std::string& text) {
    constexpr char BLANKS[] = " \t\r";
    const std::size_t begin = text.find_first_not_of(BLANKS);
    if (begin == std::string::npos) {
        return {};
    }
    return text.substr(begin, text.find_last_not_of(BLANKS) - begin + 1);
}

std::string unquoted(const std::string& text) {
    const bool isQuoted = text.size() >= 2 && text.front() == '"' && text.back() == '"';
    return isQuoted ? text.substr(1, text.size() - 2) : text;
}

// Return whether a component of `path` is `name`.
bool hasComponent(const std::string& path, const std::string& name) {
    return ("/" + path + "/").find("/" + name + "/") != std::string::npos;
}

std::vector<std::string> blockDevices() {
    std::vector<std::string> names;
    const Directory directory(opendir("/sys/block"));
    if (!directory) {
        return names;
    }
    while (const dirent* const entry = readdir(directory.get())) {
        if (entry->d_name[0] != '.') {
            names.emplace_back(static_cast<const char*>(entry->d_name));
        }
    }
    std::sort(names.begin(), names.end());
    return names;
}

bool isOpticalDrive(const std::string& device) {
    constexpr char SCSI_CD_ROM[] = "5";
    const std::optional<std::string> type = textOf("/sys/block/" + device + "/device/type");
    return type && type->substr(0, type->find('\n')) == SCSI_CD_ROM;
}

std::string devicePath(const std::string& device) {
    std::string target(4096, '\0');
    const ssize_t size = readlink(("/sys/block/" + device).c_str(), target.data(), target.size());
    target.resize(size < 0 ? 0 : static_cast<std::size_t>(size));
    return target;
}

}  // namespace

extern "C" {

int PLATExecv(const char* path, const char* const argv[], int wait) {
    if (wait == 0) {
        return startDetached(path, argv);
    }
    pid_t pid = 0;
    if (start(&pid, path, argv, -1, -1) != 0) {
        return FAILURE;
    }
    return exitedWithSuccess(waitForEnd(pid)) ? 0 : FAILURE;
}

int PLATExec(const char* path, ...) try {
    std::vector<const char*> argv = {path};
    va_list arguments;
    va_start(arguments, path);
    while (argv.back() != nullptr) {
        argv.push_back(va_arg(arguments, const char*));
    }
    va_end(arguments);
    return PLATExecv(path, argv.data(), 1);
} catch (const std::bad_alloc&) {
    return FAILURE;
}

FILE* PLATPopenv(const char* path, const char* mode, const char* const argv[]) try {
    const bool isRead = mode != nullptr && std::strcmp(mode, "r") == 0;
    const bool isWrite = mode != nullptr && std::strcmp(mode, "w") == 0;
    if (!isRead && !isWrite) {
        errno = EINVAL;
        return nullptr;
    }
    // Everything that can fail precedes the start, which cannot be undone.
    Streams& table = streams();
    Streams entry = {{nullptr, 0}};
    auto node = entry.extract(nullptr);

    int ends[2] = {-1, -1};
    if (pipe2(ends, O_CLOEXEC) != 0) {
        return nullptr;
    }
    const int ours = isRead ? ends[0] : ends[1];
    const int theirs = isRead ? ends[1] : ends[0];
    File stream(fdopen(ours, mode));
    if (!stream) {
        const int error = errno;
        close(ours);
        close(theirs);
        errno = error;
        return nullptr;
    }
    const int error = start(&node.mapped(), path, argv, theirs, isRead ? STDOUT_FILENO : STDIN_FILENO);
    close(theirs);
    if (error != 0) {
        stream.reset();
        errno = error;
        return nullptr;
    }
    node.key() = stream.get();
    const std::lock_guard<std::mutex> lock(streamsMutex);
    table.insert(std::move(node));
    return stream.release();
} catch (const std::bad_alloc&) {
    errno = ENOMEM;
    return nullptr;
}

int PLATPclose(FILE* stream) {
    pid_t pid = 0;
    {
        const std::lock_guard<std::mutex> lock(streamsMutex);
        const auto entry = streams().find(stream);
        if (entry == streams().end()) {
            errno = EINVAL;
            return FAILURE;
        }
        pid = entry->second;
        streams().erase(entry);
    }
    (void)std::fclose(stream);  // the program's end tells how it went
    return waitForEnd(pid);
}

int PLATFileGetKeyValue(const char* file, const char* key, char* value, int size, int flags) try {
    if (value == nullptr || size < 1) {
        return FAILURE;
    }
    value[0] = '\0';
    if (file == nullptr || key == nullptr || flags != 0) {
        return FAILURE;
    }
    const std::optional<std::string> text = textOf(file);
    if (!text) {
        return FAILURE;
    }
    std::istringstream stream(*text);
    std::string line;
    while (std::getline(stream, line)) {
        line = trimmed(line);
        const std::size_t separator = line.find('=');
        if (line.empty() || line.front() == '#' || separator == std::string::npos ||
            trimmed(line.substr(0, separator)) != key) {
            continue;
        }
        const std::string found = unquoted(trimmed(line.substr(separator + 1)));
        value[found.copy(value, static_cast<std::size_t>(size) - 1)] = '\0';
        return 1;
    }
    return stream.bad() ? FAILURE : 0;
} catch (const std::bad_alloc&) {
    return FAILURE;
}

bool PLATFileExist(const char* path) {
    struct stat info = {};
    return path != nullptr && stat(path, &info) == 0;
}

int TERNDiskGetDevnamebyAtaPort(char* name, int size, const char* port) try {
    if (name == nullptr || size < 1 || port == nullptr || port[0] == '\0') {
        return FAILURE;
    }
    for (const std::string& device : blockDevices()) {
        if (!hasComponent(devicePath(device), port) || isOpticalDrive(device)) {
            continue;
        }
        if (device.size() >= static_cast<std::size_t>(size)) {
            return FAILURE;
        }
        name[device.copy(name, static_cast<std::size_t>(size) - 1)] = '\0';
        return 0;
    }
    return FAILURE;
} catch (const std::bad_alloc&) {
    return FAILURE;
}
}
