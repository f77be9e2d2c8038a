#include "support/programs.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <utility>

#include "support/files.h"
#include "support/wait.h"

namespace test {
namespace {

void cover(const std::string& path, const std::string& by) {
    const std::string program = std::filesystem::canonical(path);
    check(mount(by.c_str(), program.c_str(), "", MS_BIND, nullptr) == 0, "cannot cover " + program);
}

// Read from the start without moving the position, which the writer shares.
std::string collected(const Descriptor& file) {
    std::string text;
    char block[4096];
    ssize_t length = 0;
    while ((length = pread(file.get(), block, sizeof block, static_cast<off_t>(text.size()))) > 0) {
        text.append(block, static_cast<std::size_t>(length));
    }
    return text;
}

// Fork; the child, in `node` if given, runs `body`, which does not return or returns the errno of
// its failure. Throws if fork fails or the child fails before it closes the descriptor of its
// report.
pid_t spawn(int node, const std::function<int(int report)>& body) {
    int ends[2] = {-1, -1};
    check(pipe2(ends, O_CLOEXEC) == 0, "cannot make a pipe");
    const Descriptor readEnd(ends[0], "pipe");
    Descriptor writeEnd(ends[1], "pipe");

    // A pid namespace applies only to children; the others require a single-threaded process.
    const Descriptor own(open("/proc/self/ns/pid", O_RDONLY | O_CLOEXEC), "cannot open the pid namespace");
    check(node == -1 || setns(node, CLONE_NEWPID) == 0, "cannot enter the node's processes");
    const pid_t child = fork();
    if (child == 0) {
        const bool isThere =
            node == -1 || (unshare(CLONE_FS) == 0 &&
                           setns(node, CLONE_NEWNS | CLONE_NEWNET | CLONE_NEWIPC | CLONE_NEWUTS) == 0);
        const int error = isThere ? body(writeEnd.get()) : errno;
        [[maybe_unused]] const ssize_t written = write(writeEnd.get(), &error, sizeof error);
        _exit(127);
    }
    const int forkError = errno;
    check(node == -1 || setns(own.get(), CLONE_NEWPID) == 0, "cannot return from the node's processes");
    check(child != -1, "cannot fork", forkError);

    writeEnd.reset();
    int error = 0;
    if (read(readEnd.get(), &error, sizeof error) == sizeof error) {
        waitpid(child, nullptr, 0);
        check(false, "cannot start a process", error);
    }
    return child;
}

// Runs after fork: only system calls are safe.
int becomeProgram(const std::vector<char*>& argv, int input, int output, int error) {
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    if (dup2(input, STDIN_FILENO) != -1 && dup2(output, STDOUT_FILENO) != -1 &&
        dup2(error, STDERR_FILENO) != -1 && close_range(STDERR_FILENO + 1, ~0U, CLOSE_RANGE_CLOEXEC) == 0) {
        execvp(argv[0], argv.data());
    }
    return errno;
}

[[noreturn]] void becomeFunction(const std::function<int()>& function) {
    const bool hadFailed = ::testing::Test::HasFailure();
    int result = 1;
    try {
        result = function();
    } catch (const std::exception& exception) {
        std::fprintf(stderr, "exception in a node: %s\n", exception.what());
    }
    std::fflush(nullptr);
    _exit(result == 0 && !hadFailed && ::testing::Test::HasFailure() ? 1 : result);
}

}  // namespace

void replaceProgram(const std::string& path, const std::string& script) {
    static int count = 0;
    const std::string stub = "/run/programs/" + std::to_string(getpid()) + "-" + std::to_string(++count);
    createProgram(stub, script);
    cover(path, stub);
}

void hideProgram(const std::string& path) {
    cover(path, "/dev/null");
}

void restoreProgram(const std::string& path) {
    const std::string program = std::filesystem::canonical(path);
    check(umount2(program.c_str(), MNT_DETACH) == 0, "cannot uncover " + program);
}

void createProgram(const std::string& path, const std::string& script) {
    writeFile(path, script.compare(0, 2, "#!") == 0 ? script : "#!/bin/sh\n" + script);
    check(chmod(path.c_str(), 0755) == 0, "cannot make " + path + " executable");
}

Process::Process(const std::vector<std::string>& argv, int node)
    : _output(memfd_create("output", MFD_CLOEXEC), "cannot make a memory file"),
      _error(memfd_create("error", MFD_CLOEXEC), "cannot make a memory file") {
    const Descriptor input(open("/dev/null", O_RDONLY | O_CLOEXEC), "cannot open /dev/null");
    std::vector<std::string> texts = argv;
    std::vector<char*> pointers;
    for (std::string& text : texts) {
        pointers.push_back(text.data());
    }
    pointers.push_back(nullptr);
    _pid =
        spawn(node, [&](int) { return becomeProgram(pointers, input.get(), _output.get(), _error.get()); });
}

Process::Process(const std::function<int()>& function, int node) {
    std::fflush(nullptr);
    _pid = spawn(node, [&](int report) -> int {
        close(report);
        becomeFunction(function);
    });
}

Process& Process::operator=(Process&& other) noexcept {
    std::swap(_output, other._output);
    std::swap(_error, other._error);
    std::swap(_pid, other._pid);
    std::swap(_status, other._status);
    return *this;
}

Process::~Process() {
    if (_pid != -1) {
        signal(SIGKILL);
        reap(0);
    }
}

void Process::signal(int number) const {
    if (!_status) {
        kill(_pid, number);
    }
}

bool Process::reap(int flags) {
    int status = 0;
    pid_t reaped = -1;
    while (!_status && (reaped = waitpid(_pid, &status, flags)) == -1 && errno == EINTR) {
    }
    if (!_status && reaped == _pid) {
        _status = status;
    }
    return _status.has_value();
}

std::optional<int> Process::waitFor(std::chrono::milliseconds deadline) {
    eventually(deadline, [this] { return reap(WNOHANG); });
    return _status;
}

int Process::wait() {
    check(reap(0), "cannot wait for a process");
    return *_status;
}

std::string Process::output() const {
    return collected(_output);
}

std::string Process::error() const {
    return collected(_error);
}

CommandResult resultOf(Process process) {
    const int status = process.wait();
    const int exitCode = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    return {status, exitCode, process.output(), process.error()};
}

CommandResult run(const std::vector<std::string>& argv) {
    return resultOf(Process(argv));
}

}  // namespace test
