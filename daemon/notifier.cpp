#include "notifier.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <vector>

#include "passes.h"

namespace ternhad {

namespace {

constexpr auto LIMIT = std::chrono::seconds(30);
constexpr auto STEP = std::chrono::milliseconds(50);

// Return the daemon's environment without the variables of the service manager, and with those of
// the transition.
std::vector<std::string> environmentOf(const Transition& transition, const std::string& peer) {
    std::vector<std::string> environment;
    for (char** variable = environ; *variable != nullptr; ++variable) {
        const std::string text = *variable;
        if (text.rfind("NOTIFY_SOCKET=", 0) != 0 && text.rfind("WATCHDOG_", 0) != 0) {
            environment.push_back(text);
        }
    }
    environment.push_back(std::string("EVENT=") + nameOf(transition.flag).name);
    environment.push_back(std::string("OLD=") + conditionOf(transition.flag, transition.old));
    environment.push_back(std::string("NEW=") + conditionOf(transition.flag, transition.value));
    environment.push_back("TIME=" + std::to_string(static_cast<long long>(secondsOf(transition.time))));
    environment.push_back("PEER=" + peer);
    return environment;
}

// Return a null-terminated vector of pointers into `texts`.
std::vector<char*> pointersTo(std::vector<std::string>& texts) {
    std::vector<char*> pointers;
    pointers.reserve(texts.size() + 1);
    for (std::string& text : texts) {
        pointers.push_back(text.data());
    }
    pointers.push_back(nullptr);
    return pointers;
}

std::string resultOf(int status) {
    return WIFSIGNALED(status) ? "signal " + std::to_string(WTERMSIG(status))
                               : "exit code " + std::to_string(WEXITSTATUS(status));
}

}  // namespace

void Notifier::run() {
    Passes passes;
    do {
        _reader.event().take();
        passes.run([this] {
            std::uint64_t lost = 0;
            while (const auto transition = _reader.next(lost)) {
                if (_shutdown.isRequested()) {
                    return;
                }
                if (lost > 0) {
                    TERNHAD_LOG(_events, "Notifications lost: " + std::to_string(lost));
                }
                notify(*transition);
            }
        });
    } while (_shutdown.waitFor(_reader.event()));
}

void Notifier::notify(const Transition& transition) {
    const std::string what = _options.notify + " for " + conditionOf(transition.flag, transition.value);
    const pid_t process = start(transition);
    if (process < 0) {
        TERNHAD_LOG(_events, "Cannot run " + what + ": " + std::strerror(errno));
        return;
    }
    int status = 0;
    const bool hasEnded = waitFor(process, status);
    kill(-process, SIGKILL);  // including its background processes
    if (hasEnded) {
        TERNHAD_LOG(_events, "Ran " + what + ": " + resultOf(status));
        return;
    }
    waitpid(process, &status, 0);
    if (!_shutdown.isRequested()) {
        TERNHAD_LOG(_events, "Killed " + what + " after 30 seconds");
    }
}

pid_t Notifier::start(const Transition& transition) {
    std::string peer = _findings.peerName();
    if (peer.empty()) {
        peer = _options.remoteIp;
    }
    std::vector<std::string> environment = environmentOf(transition, peer);
    std::vector<std::string> arguments = {_options.notify};

    posix_spawnattr_t attributes;
    posix_spawnattr_init(&attributes);
    sigset_t signals;
    sigemptyset(&signals);
    posix_spawnattr_setsigmask(&attributes, &signals);
    sigfillset(&signals);
    posix_spawnattr_setsigdefault(&attributes, &signals);
    posix_spawnattr_setpgroup(&attributes, 0);
    posix_spawnattr_setflags(&attributes,
                             POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETPGROUP);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);

    pid_t process = -1;
    const int error = posix_spawn(&process, _options.notify.c_str(), &actions, &attributes,
                                  pointersTo(arguments).data(), pointersTo(environment).data());
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attributes);
    errno = error;
    return error == 0 ? process : -1;
}

// Return false if it still runs after the time limit, or if the daemon stops.
bool Notifier::waitFor(pid_t process, int& status) const {
    const auto end = Clock::now() + LIMIT;
    do {
        if (waitpid(process, &status, WNOHANG) == process) {
            return true;
        }
    } while (Clock::now() < end && _shutdown.sleepUntil(Clock::now() + STEP));
    return false;
}

}  // namespace ternhad
