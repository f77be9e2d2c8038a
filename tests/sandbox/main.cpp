// ternha-sandbox: runs a program in a world of its own, so that what it does to files, processes and the
// network stays there.

#include <fcntl.h>
#include <linux/sched.h>
#include <net/if.h>
#include <sched.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/personality.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iostream>

#include "machine.h"
#include "options.h"
#include "processes.h"
#include "refusal.h"
#include "root.h"

namespace sandbox {
namespace {

constexpr int kLeftoversExit = 97;
constexpr int kRefusedExit = 98;
constexpr int kNotStartedExit = 127;
constexpr std::chrono::seconds kGrace{2};

void say(const std::string& message) {
    std::cerr << "ternha-sandbox: " << message << std::endl;
}

struct Pipe {
    Pipe() {
        int ends[2] = {-1, -1};
        require(pipe2(ends, O_CLOEXEC) == 0, "cannot make a pipe");
        readEnd = ends[0];
        writeEnd = ends[1];
    }
    int readEnd = -1;
    int writeEnd = -1;
};

// False when the other end was closed without a word.
bool readSignal(const Pipe& pipe) {
    close(pipe.writeEnd);
    char byte = 0;
    const bool received = read(pipe.readEnd, &byte, 1) == 1;
    close(pipe.readEnd);
    return received;
}

void writeSignal(const Pipe& pipe) {
    close(pipe.readEnd);
    require(write(pipe.writeEnd, "", 1) == 1, "cannot write to a pipe");
    close(pipe.writeEnd);
}

// A fork into new namespaces. Root keeps its user namespace, so that it stays root.
pid_t forkIntoNamespaces(bool ownUsers) {
    clone_args arguments{};
    arguments.flags = CLONE_NEWNS | CLONE_NEWNET | CLONE_NEWPID | CLONE_NEWIPC | CLONE_NEWUTS;
    if (ownUsers) {
        arguments.flags |= CLONE_NEWUSER;
    }
    arguments.exit_signal = SIGCHLD;
    const long child = syscall(SYS_clone3, &arguments, sizeof arguments);
    require(child != -1, ownUsers ? "cannot make user, mount, net, pid, ipc and uts namespaces"
                                  : "cannot make mount, net, pid, ipc and uts namespaces");
    return static_cast<pid_t>(child);
}

void writeMap(pid_t child, const char* name, const std::string& text) {
    std::ofstream file("/proc/" + std::to_string(child) + "/" + name);
    file << text;
    file.close();
    require(file.good(), std::string("cannot write ") + name);
}

void mapCallerToRoot(pid_t child) {
    writeMap(child, "setgroups", "deny");
    writeMap(child, "uid_map", "0 " + std::to_string(geteuid()) + " 1");
    writeMap(child, "gid_map", "0 " + std::to_string(getegid()) + " 1");
}

void raiseLoopback() {
    const int control = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    require(control != -1, "cannot make a socket");
    ifreq request{};
    std::strcpy(request.ifr_name, "lo");
    request.ifr_flags = IFF_UP | IFF_RUNNING;
    require(ioctl(control, SIOCSIFFLAGS, &request) == 0, "cannot raise the loopback interface");
    close(control);
}

std::vector<char*> pointersTo(std::vector<std::string>& texts) {
    std::vector<char*> pointers;
    for (std::string& text : texts) {
        pointers.push_back(text.data());
    }
    pointers.push_back(nullptr);
    return pointers;
}

[[noreturn]] void becomeProgram(Options& options, const std::string& directory) {
    if (chdir(directory.c_str()) != 0) {
        require(chdir("/") == 0, "cannot enter the root");
    }
    if (!options.randomizedAddresses) {
        require(personality(ADDR_NO_RANDOMIZE) != -1, "cannot switch off address randomization");
    }
    require(close_range(STDERR_FILENO + 1, ~0U, CLOSE_RANGE_CLOEXEC) == 0, "cannot mark descriptors");
    unblockSignals();
    std::vector<std::string> environment = cleanEnvironment(options);
    const auto variables = pointersTo(environment);
    const auto arguments = pointersTo(options.program);
    environ = const_cast<char**>(variables.data());
    execvp(arguments[0], arguments.data());
    say("cannot start " + options.program.front() + ": " + std::strerror(errno));
    _exit(kNotStartedExit);
}

int runProgram(Options& options, const std::string& directory) {
    const pid_t program = fork();
    require(program != -1, "cannot fork");
    if (program == 0) {
        becomeProgram(options, directory);
    }
    const int status = superviseChild(program);
    const std::vector<std::string> left = leftProcesses(kGrace);
    for (const std::string& process : left) {
        say("left behind: process " + process);
    }
    return left.empty() ? exitCodeOf(status) : kLeftoversExit;
}

int refuse(const Options& options, const std::system_error& reason) {
    say("refusing to run " + (options.isNode ? "node " + options.hostname : options.program.front()) + ": " +
        reason.what());
    return kRefusedExit;
}

// The first process of the sandbox. It ends with its last act, and the kernel then ends what is left in it.
[[noreturn]] void actAsInit(Options& options, const Pipe& mapped, const Pipe& ready,
                            const std::string& directory) {
    int exitCode = EXIT_SUCCESS;
    try {
        require(prctl(PR_SET_PDEATHSIG, SIGKILL) == 0, "cannot ask for the death signal");
        if (!readSignal(mapped)) {
            _exit(kRefusedExit);
        }
        require(sethostname(options.hostname.data(), options.hostname.size()) == 0,
                "cannot set the host name");
        raiseLoopback();
        enterPrivateRoot(options.binds);
        writeSignal(ready);
        if (options.isNode) {
            reapUntilTerminated();
        } else {
            exitCode = runProgram(options, directory);
        }
    } catch (const std::system_error& reason) {
        exitCode = refuse(options, reason);
    }
    _exit(exitCode);
}

std::string workingDirectory() {
    char* directory = getcwd(nullptr, 0);
    std::string path = directory != nullptr ? directory : "/";
    std::free(directory);
    return path;
}

int launch(Options& options) {
    const std::vector<Bind> inherited = inheritedBinds();
    options.binds.insert(options.binds.begin(), inherited.begin(), inherited.end());
    const std::string directory = workingDirectory();
    const bool ownUsers = geteuid() != 0;
    const MachineState before = observeMachine();

    blockSignals();
    const Pipe mapped;
    const Pipe ready;
    const pid_t child = forkIntoNamespaces(ownUsers);
    if (child == 0) {
        actAsInit(options, mapped, ready, directory);
    }
    if (ownUsers) {
        try {
            mapCallerToRoot(child);
        } catch (const Refusal&) {
            kill(child, SIGKILL);
            superviseChild(child);
            throw;
        }
    }
    writeSignal(mapped);
    const bool isReady = readSignal(ready);
    if (isReady && options.isNode) {
        std::cout << "ready " << child << std::endl;
    }
    const int exitCode = exitCodeOf(superviseChild(child));
    if (!isReady || options.isNode) {
        return exitCode;
    }
    const std::vector<std::string> changes = differences(before, observeMachine());
    for (const std::string& change : changes) {
        say("changed outside: " + change);
    }
    return changes.empty() ? exitCode : kLeftoversExit;
}

}  // namespace
}  // namespace sandbox

int main(int argc, char** argv) {
    int exitCode = EXIT_SUCCESS;
    std::optional<sandbox::Options> options = sandbox::parseOptions(argc, argv, exitCode);
    if (!options) {
        return exitCode;
    }
    try {
        return sandbox::launch(*options);
    } catch (const std::system_error& reason) {
        return sandbox::refuse(*options, reason);
    }
}
