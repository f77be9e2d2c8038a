#include "processes.h"

#include <signal.h>
#include <sys/wait.h>
#include <time.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "root.h"

namespace sandbox {
namespace {

sigset_t awaitedSignals() {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGCHLD);
    return signals;
}

int awaitSignal() {
    const sigset_t signals = awaitedSignals();
    int signal = -1;
    while (signal == -1) {
        signal = sigwaitinfo(&signals, nullptr);
    }
    return signal;
}

void reapChildren() {
    while (waitpid(-1, nullptr, WNOHANG) > 0) {
    }
}

std::string commandLine(const std::filesystem::path& process) {
    std::ifstream file(process / "cmdline", std::ios::binary);
    std::ostringstream content;
    content << file.rdbuf();
    std::string text = content.str();
    if (text.empty()) {
        std::ifstream name(process / "comm");
        std::getline(name, text);
    }
    while (!text.empty() && text.back() == '\0') {
        text.pop_back();
    }
    std::replace(text.begin(), text.end(), '\0', ' ');
    return text;
}

std::vector<std::string> otherProcesses() {
    std::vector<std::string> processes;
    for (const auto& entry : std::filesystem::directory_iterator(kKernelProc)) {
        const std::string name = entry.path().filename();
        if (name != "1" && name.find_first_not_of("0123456789") == std::string::npos) {
            processes.push_back(name + " (" + commandLine(entry.path()) + ")");
        }
    }
    return processes;
}

}  // namespace

void blockSignals() {
    const sigset_t signals = awaitedSignals();
    sigprocmask(SIG_BLOCK, &signals, nullptr);
}

void unblockSignals() {
    const sigset_t signals = awaitedSignals();
    sigprocmask(SIG_UNBLOCK, &signals, nullptr);
}

int superviseChild(pid_t child) {
    while (true) {
        const int signal = awaitSignal();
        if (signal != SIGCHLD) {
            kill(child, signal);
            continue;
        }
        int status = 0;
        pid_t reaped = 0;
        while ((reaped = waitpid(-1, &status, WNOHANG)) > 0) {
            if (reaped == child) {
                return status;
            }
        }
    }
}

void reapUntilTerminated() {
    while (awaitSignal() == SIGCHLD) {
        reapChildren();
    }
}

int exitCodeOf(int status) {
    constexpr int kSignalBase = 128;
    return WIFEXITED(status) ? WEXITSTATUS(status) : kSignalBase + WTERMSIG(status);
}

std::vector<std::string> leftProcesses(std::chrono::milliseconds grace) {
    const auto deadline = std::chrono::steady_clock::now() + grace;
    while (true) {
        reapChildren();
        std::vector<std::string> processes = otherProcesses();
        if (processes.empty() || std::chrono::steady_clock::now() >= deadline) {
            return processes;
        }
        const timespec interval{0, 5'000'000};
        nanosleep(&interval, nullptr);
    }
}

}  // namespace sandbox
