#include "support/spawn.h"

#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>

#include "support/descriptor.h"

namespace test {
namespace {

constexpr int kNotStartedExit = 127;

// What the new processes tell on the way to running the body.
struct Report {
    pid_t process;
    int error;
};

void tell(int report, pid_t process, int error) {
    const Report message{process, error};
    // A reader that has gone needs no report.
    [[maybe_unused]] const ssize_t written = write(report, &message, sizeof message);
}

int enterNode(int node) {
    // Only a process that shares its root with no other thread may change its mount namespace.
    const bool entered = unshare(CLONE_FS) == 0 && setns(node, CLONE_NEWNS | CLONE_NEWNET | CLONE_NEWPID |
                                                                   CLONE_NEWIPC | CLONE_NEWUTS) == 0;
    return entered ? 0 : errno;
}

[[noreturn]] void runBody(const std::function<int(const std::function<void()>&)>& body, int report) {
    const int error = body([report] { close(report); });
    tell(report, -1, error);
    _exit(kNotStartedExit);
}

// Ends as `process` ended, by the same signal if need be.
[[noreturn]] void endLike(pid_t process) {
    int status = 0;
    while (waitpid(process, &status, 0) == -1 && errno == EINTR) {
    }
    if (WIFSIGNALED(status)) {
        signal(WTERMSIG(status), SIG_DFL);
        kill(getpid(), WTERMSIG(status));
    }
    _exit(WEXITSTATUS(status));
}

// A pid namespace takes in only the children of a process that enters it: there is one process in between.
[[noreturn]] void runBodyInNode(const std::function<int(const std::function<void()>&)>& body, int report,
                                int node) {
    const int error = enterNode(node);
    const pid_t process = error == 0 ? fork() : -1;
    if (process == 0) {
        runBody(body, report);
    }
    tell(report, process, error);
    if (process == -1) {
        _exit(kNotStartedExit);
    }
    // Sockets of the test must not stay open here after the test has closed them.
    close_range(STDERR_FILENO + 1, ~0U, 0);
    endLike(process);
}

}  // namespace

Spawned spawn(const std::function<int(const std::function<void()>&)>& body, int node) {
    int ends[2] = {-1, -1};
    if (pipe2(ends, O_CLOEXEC) == -1) {
        throw std::system_error(errno, std::generic_category(), "cannot make a pipe");
    }
    const Descriptor readEnd(ends[0], "pipe");
    Descriptor writeEnd(ends[1], "pipe");

    Spawned spawned;
    spawned.child = fork();
    if (spawned.child == -1) {
        throw std::system_error(errno, std::generic_category(), "cannot fork");
    }
    if (spawned.child == 0) {
        if (node == -1) {
            runBody(body, writeEnd.get());
        }
        runBodyInNode(body, writeEnd.get(), node);
    }
    spawned.process = spawned.child;
    writeEnd.reset();

    Report report{};
    int error = 0;
    while (read(readEnd.get(), &report, sizeof report) == sizeof report) {
        if (report.error != 0) {
            error = report.error;
        } else {
            spawned.process = report.process;
        }
    }
    if (error != 0) {
        waitpid(spawned.child, nullptr, 0);
        throw std::system_error(error, std::generic_category(), "cannot start a process");
    }
    return spawned;
}

}  // namespace test
