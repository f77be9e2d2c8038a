#include "support/programs.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <exception>
#include <filesystem>
#include <utility>

#include "support/files.h"
#include "support/sandbox_check.h"
#include "support/wait.h"

namespace test {
namespace {

constexpr mode_t kExecutable = 0755;

void check(bool done, const std::string& what) {
    if (!done) {
        throw std::system_error(errno, std::generic_category(), what);
    }
}

void cover(const std::string& path, const std::string& by) {
    const std::string program = std::filesystem::canonical(path);
    check(mount(by.c_str(), program.c_str(), "", MS_BIND, nullptr) == 0, "cannot cover " + program);
}

void writeScript(const std::string& path, const std::string& script) {
    writeFile(path, script.compare(0, 2, "#!") == 0 ? script : "#!/bin/sh\n" + script);
    check(chmod(path.c_str(), kExecutable) == 0, "cannot make " + path + " executable");
}

Descriptor collector(const char* name) {
    return {memfd_create(name, MFD_CLOEXEC), "cannot make a memory file"};
}

// Reads from the start and leaves the position, which the writer shares, where it is.
std::string collected(const Descriptor& file) {
    std::string text;
    char block[4096];
    ssize_t length = 0;
    while (file.get() != -1 &&
           (length = pread(file.get(), block, sizeof block, static_cast<off_t>(text.size()))) > 0) {
        text.append(block, static_cast<size_t>(length));
    }
    return text;
}

// Runs in a process just forked: no more than system calls.
int becomeProgram(const std::vector<char*>& argv, int input, int output, int error) {
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    if (dup2(input, STDIN_FILENO) == -1 || dup2(output, STDOUT_FILENO) == -1 ||
        dup2(error, STDERR_FILENO) == -1 || close_range(STDERR_FILENO + 1, ~0U, CLOSE_RANGE_CLOEXEC) == -1) {
        return errno;
    }
    execvp(argv[0], argv.data());
    return errno;
}

int resultWithFailures(const std::function<int()>& function) {
    const bool failedBefore = ::testing::Test::HasFailure();
    int result = 1;
    try {
        result = function();
    } catch (const std::exception& exception) {
        std::fprintf(stderr, "exception in a node: %s\n", exception.what());
    }
    return result == 0 && !failedBefore && ::testing::Test::HasFailure() ? 1 : result;
}

}  // namespace

void replaceProgram(const std::string& path, const std::string& script) {
    requireSandbox();
    static int count = 0;
    const std::string standIn = "/run/programs/" + std::to_string(getpid()) + "-" + std::to_string(++count);
    writeScript(standIn, script);
    cover(path, standIn);
}

void hideProgram(const std::string& path) {
    requireSandbox();
    cover(path, "/dev/null");
}

void restoreProgram(const std::string& path) {
    requireSandbox();
    const std::string program = std::filesystem::canonical(path);
    check(umount2(program.c_str(), MNT_DETACH) == 0, "cannot uncover " + program);
}

void createProgram(const std::string& path, const std::string& script) {
    writeScript(path, script);
}

Process::Process(const std::vector<std::string>& argv) : Process(argv, -1) {}

Process::Process(const std::vector<std::string>& argv, int node)
    : output_(collector("output")), error_(collector("error")) {
    requireSandbox();
    const Descriptor input(open("/dev/null", O_RDONLY | O_CLOEXEC), "cannot open /dev/null");
    std::vector<std::string> texts = argv;
    std::vector<char*> pointers;
    for (std::string& text : texts) {
        pointers.push_back(text.data());
    }
    pointers.push_back(nullptr);
    spawned_ = spawn(
        [&](const auto&) { return becomeProgram(pointers, input.get(), output_.get(), error_.get()); }, node);
}

Process::Process(const std::function<int()>& function, int node) {
    requireSandbox();
    std::fflush(nullptr);
    spawned_ = spawn(
        [&](const auto& started) -> int {
            started();
            const int result = resultWithFailures(function);
            std::fflush(nullptr);
            _exit(result);
        },
        node);
}

Process::Process(Process&& other) noexcept
    : output_(std::move(other.output_)),
      error_(std::move(other.error_)),
      spawned_(std::exchange(other.spawned_, {})),
      status_(other.status_) {}

Process& Process::operator=(Process&& other) noexcept {
    std::swap(output_, other.output_);
    std::swap(error_, other.error_);
    std::swap(spawned_, other.spawned_);
    std::swap(status_, other.status_);
    return *this;
}

Process::~Process() {
    if (spawned_.child != -1 && !status_) {
        signal(SIGKILL);
        reap(0);
    }
}

void Process::signal(int number) {
    if (!status_) {
        kill(spawned_.process, number);
    }
}

bool Process::reap(int flags) {
    if (status_) {
        return true;
    }
    int status = 0;
    pid_t reaped = -1;
    do {
        reaped = waitpid(spawned_.child, &status, flags);
    } while (reaped == -1 && errno == EINTR);
    if (reaped == spawned_.child) {
        status_ = status;
    }
    return status_.has_value();
}

std::optional<int> Process::waitFor(std::chrono::milliseconds deadline) {
    eventually(deadline, [this] { return reap(WNOHANG); });
    return status_;
}

int Process::wait() {
    check(reap(0), "cannot wait for a process");
    return *status_;
}

std::string Process::output() const {
    return collected(output_);
}

std::string Process::error() const {
    return collected(error_);
}

CommandResult resultOf(Process process) {
    CommandResult result;
    result.status = process.wait();
    result.exitCode = WIFEXITED(result.status) ? WEXITSTATUS(result.status) : 128 + WTERMSIG(result.status);
    result.output = process.output();
    result.error = process.error();
    return result;
}

CommandResult run(const std::vector<std::string>& argv) {
    return resultOf(Process(argv));
}

}  // namespace test
