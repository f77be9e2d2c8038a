#include "log_keeper.h"

#include <fcntl.h>
#include <json/json.h>
#include <poll.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <csignal>
#include <filesystem>

namespace ternhad {

namespace {

constexpr auto RESTART_DELAY = std::chrono::seconds(1);
constexpr auto HANGS_AFTER = std::chrono::seconds(60);
constexpr std::int64_t SLOWEST_XZ = 100000;  // bytes per second; extends the time limit for a large log
constexpr std::size_t MOST_LEFT_BEHIND = 4;
constexpr auto GRACE = std::chrono::milliseconds(500);  // at the stop, for the request in progress
constexpr char STARTING[] = "start the log keeper";

Clock::duration toDuration(Seconds seconds) {
    return std::chrono::duration_cast<Clock::duration>(seconds);
}

std::string statusText(TERN::HA::Daemon::Status& status) {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    return Json::writeString(builder, status.toJson());
}

// Spawn attributes of the child: default signal handling, no descriptors except the pipes and
// standard error.
class Spawn {
 public:
    Spawn(int input, int output) {
        posix_spawn_file_actions_init(&_actions);
        posix_spawn_file_actions_adddup2(&_actions, input, STDIN_FILENO);
        posix_spawn_file_actions_adddup2(&_actions, output, STDOUT_FILENO);
        sigset_t none;
        sigset_t all;
        sigemptyset(&none);
        sigfillset(&all);
        posix_spawnattr_init(&_attributes);
        posix_spawnattr_setsigmask(&_attributes, &none);
        posix_spawnattr_setsigdefault(&_attributes, &all);
        posix_spawnattr_setpgroup(&_attributes, 0);  // together with its programs
        posix_spawnattr_setflags(&_attributes,
                                 POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETPGROUP);
    }

    ~Spawn() {
        posix_spawnattr_destroy(&_attributes);
        posix_spawn_file_actions_destroy(&_actions);
    }

    Spawn(const Spawn&) = delete;
    Spawn& operator=(const Spawn&) = delete;

    // Return the process, or -1 with errno.
    pid_t run(const std::string& program, const std::string& rotateSize) const {
        const std::array<const char*, 4> argv = {"ternhad", LOG_KEEPER, rotateSize.c_str(), nullptr};
        pid_t process = -1;
        errno = posix_spawn(&process, program.c_str(), &_actions, &_attributes,
                            const_cast<char* const*>(argv.data()), environ);
        return errno == 0 ? process : -1;
    }

 private:
    posix_spawn_file_actions_t _actions = {};
    posix_spawnattr_t _attributes = {};
};

}  // namespace

LogKeeper::LogKeeper(const Options& options, Health& health, Events& events)
    : _options(options),
      _health(health),
      _events(events),
      _program(std::filesystem::read_symlink("/proc/self/exe")),
      _nextMove(Clock::now() + toDuration(options.logInterval)),
      _nextSnapshot(Clock::now()) {}

LogKeeper::~LogKeeper() {
    closePipes();
}

void LogKeeper::closePipes() {
    for (int* pipe : {&_requests, &_replies}) {
        if (*pipe >= 0) {
            close(*pipe);
            *pipe = -1;
        }
    }
}

bool LogKeeper::start() {
    _nextStart = Clock::now() + RESTART_DELAY;
    std::array<int, 2> requests = {-1, -1};
    std::array<int, 2> replies = {-1, -1};
    if (pipe2(requests.data(), O_CLOEXEC | O_DIRECT) == 0 && pipe2(replies.data(), O_CLOEXEC) == 0) {
        _process = Spawn(requests[0], replies[1]).run(_program, std::to_string(_options.rotateSize));
    }
    const int error = errno;
    _requests = requests[1];
    _replies = replies[0];
    for (const int childsEnd : {requests[0], replies[1]}) {
        if (childsEnd >= 0) {
            close(childsEnd);
        }
    }
    if (_process < 0) {
        closePipes();
        errno = error;
        return false;
    }
    for (const int end : {_requests, _replies}) {
        fcntl(end, F_SETFL, fcntl(end, F_GETFL) | O_NONBLOCK);
    }
    _busySince.reset();
    return true;
}

void LogKeeper::work() {
    takeReply();
    reap();
    replaceIfHanging();
    if (_process < 0 && Clock::now() >= _nextStart && _leftBehind.size() < MOST_LEFT_BEHIND && !start()) {
        _events.troubleBegan(STARTING, errno);
    }
    sendNext();
}

Clock::time_point LogKeeper::workTime() const {
    if (_process < 0) {
        return std::max(_nextStart, Clock::now() + RESTART_DELAY);
    }
    if (_busySince && isNextDue()) {
        return hangTime();
    }
    return std::min({_nextMove, _nextSnapshot, hangTime()});
}

bool LogKeeper::isNextDue() const {
    return _isSnapshotWanted || _isRotationWanted || Clock::now() >= std::min(_nextMove, _nextSnapshot);
}

// When the request in progress has taken too long.
Clock::time_point LogKeeper::hangTime() const {
    return _busySince ? *_busySince + HANGS_AFTER + std::chrono::seconds(_options.rotateSize / SLOWEST_XZ)
                      : Clock::time_point::max();
}

void LogKeeper::reap() {
    const auto isGone = [](pid_t process) { return waitpid(process, nullptr, WNOHANG) != 0; };
    _leftBehind.erase(std::remove_if(_leftBehind.begin(), _leftBehind.end(), isGone), _leftBehind.end());
    if (_process >= 0 && isGone(_process)) {
        TERNHAD_LOG(_events, "The log keeper has exited: restarting it");
        _process = -1;
        closePipes();
    }
}

void LogKeeper::replaceIfHanging() {
    if (_process >= 0 && Clock::now() >= hangTime()) {
        TERNHAD_LOG(_events, "The log keeper hangs: replacing it");
        leaveBehind(SIGKILL);
        _nextStart = Clock::now();
    }
}

void LogKeeper::leaveBehind(int signal) {
    kill(-_process, signal);
    _leftBehind.push_back(_process);
    _process = -1;
    _busySince.reset();
    closePipes();
}

void LogKeeper::takeReply() {
    char done = 0;
    if (_replies >= 0 && read(_replies, &done, 1) == 1) {
        _busySince.reset();
    }
}

bool LogKeeper::send(const std::string& request) {
    if (write(_requests, request.data(), std::min(request.size(), std::size_t{PIPE_BUF})) < 0) {
        return false;
    }
    _busySince = Clock::now();
    return true;
}

void LogKeeper::sendNext() {
    const auto now = Clock::now();
    const auto text = [](LogRequest request) { return std::string(1, static_cast<char>(request)); };
    if (_process < 0 || _busySince) {
        return;
    }
    if (_isSnapshotWanted || now >= _nextSnapshot) {
        if (send(text(LogRequest::snapshot) + statusText(_health.status()))) {
            _isSnapshotWanted = false;
            _nextSnapshot = now + toDuration(_options.snapshotInterval);
        }
    } else if (_isRotationWanted || now >= _nextMove) {
        if (send(text(_isRotationWanted ? LogRequest::rotate : LogRequest::move))) {
            _isRotationWanted = false;
            _nextMove = now + toDuration(_options.logInterval);
        }
    }
}

void LogKeeper::finish(Clock::time_point deadline) {
    takeReply();
    reap();
    if (_process >= 0 && _busySince && !isDoneBy(std::min(deadline, Clock::now() + GRACE))) {
        leaveBehind(SIGTERM);  // xz removes its incomplete output
    }
    if ((_process >= 0 || start()) && send(std::string(1, static_cast<char>(LogRequest::finish)))) {
        isDoneBy(deadline);
    }
    for (const pid_t process : _leftBehind) {
        kill(-process, SIGKILL);
    }
    if (_process >= 0) {
        kill(-_process, SIGKILL);
    }
}

bool LogKeeper::isDoneBy(Clock::time_point deadline) {
    while (_busySince && Clock::now() < deadline) {
        pollfd wait = {_replies, POLLIN, 0};
        if (pollUntil(deadline, &wait, 1) > 0) {
            takeReply();
            if ((wait.revents & POLLIN) == 0) {
                return false;  // it has exited
            }
        }
    }
    return !_busySince;
}

}  // namespace ternhad
