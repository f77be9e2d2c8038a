#include "host.h"

#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <optional>
#include <string>

#include "checker.h"
#include "env_check.h"
#include "ha_log.h"
#include "liveness.h"
#include "service_notifier.h"

namespace ternhad {

using TERN::HA::Daemon::DaemonLog;
using TERN::HA::Daemon::daemonLog;
using TERN::HA::Daemon::recordLog;

namespace {

constexpr auto STOP_LIMIT = std::chrono::milliseconds(1500);
constexpr auto STOP_STEP = std::chrono::milliseconds(20);

// A question that took as long as this was not answered, whatever its result. The library waits for 3
// seconds.
constexpr auto ANSWER_LIMIT = std::chrono::milliseconds(2900);

// How long the passes of a thread may all fail.
constexpr auto FAILURE_LIMIT = std::chrono::seconds(10);

// Runs a step of the daemon. False when memory, or another means of the machine, ran out in it: the step is
// given up.
template <typename Step>
bool attempt(const Step& step) {
    try {
        step();
        return true;
    } catch (const std::exception& error) {
        (void)std::fprintf(stderr, "ternhad: a step was given up: %s\n", error.what());
        return false;
    }
}

// The passes of one thread. One that is given up costs no more than its own results; when all fail for long,
// what the daemon says of that matter is old, and no answer is better than a wrong one.
class Passes {
 public:
    template <typename Pass>
    void run(const Pass& pass) {
        if (attempt(pass)) {
            _areFailing = false;
        } else if (!_areFailing) {
            _areFailing = true;
            _failingSince = Clock::now();
        } else if (Clock::now() - _failingSince >= FAILURE_LIMIT) {
            std::abort();
        }
    }

 private:
    using Clock = std::chrono::steady_clock;

    bool _areFailing = false;
    Clock::time_point _failingSince;
};

void moveLogs() {
    daemonLog->writeLogToDisk();
    recordLog->writeLogToDisk();
}

void ignoreSignal(int) {}

// SIGUSR1 does nothing but end whatever call its thread waits in.
void setUpInterruption() {
    struct sigaction action = {};
    action.sa_handler = ignoreSignal;
    sigaction(SIGUSR1, &action, nullptr);
}

sigset_t handledSignals() {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGHUP);
    return signals;
}

// Interrupts what the other threads wait in, and ends the programs that they wait for: ping alone may take 10
// seconds.
void interruptThreads() {
    std::error_code error;
    for (const auto& task : std::filesystem::directory_iterator("/proc/self/task", error)) {
        const pid_t thread = std::stoi(task.path().filename());
        if (thread != gettid()) {
            tgkill(getpid(), thread, SIGUSR1);
        }
        std::ifstream children(task.path() / "children");
        pid_t child = 0;
        while (children >> child) {
            kill(child, SIGTERM);
        }
    }
}

// The signal that came, or 0 when none did.
int waitForSignal(const sigset_t& signals, std::chrono::microseconds limit) {
    const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(limit);
    const std::chrono::nanoseconds rest = limit - seconds;
    const timespec time = {static_cast<int>(seconds.count()), static_cast<int>(rest.count())};
    return std::max(sigtimedwait(&signals, nullptr, &time), 0);
}

std::string withoutLineEnd(std::string text) {
    while (!text.empty() && (text.back() == '\n' || text.back() == '\r')) {
        text.pop_back();
    }
    return text;
}

// Moves a log to disk and archives it when it has grown.
class LogKeeper {
 public:
    LogKeeper(DaemonLog& log, std::int64_t rotateSize) : _log(log), _rotateSize(rotateSize) {}

    void move(bool rotateNow) {
        _log.writeLogToDisk();
        if (rotateNow || _log.size() >= _nextRotation) {
            _log.rotate();
            // A log that could not be compressed is still there: every further attempt costs an archive.
            _nextRotation = _log.size() + _rotateSize;
        }
    }

 private:
    DaemonLog& _log;
    std::int64_t _rotateSize;
    std::int64_t _nextRotation = _rotateSize;
};

// When the round after the one planned for `round` begins. Rounds that could not be kept are left out.
std::chrono::steady_clock::time_point nextRound(std::chrono::steady_clock::time_point round,
                                                Seconds interval) {
    using Clock = std::chrono::steady_clock;
    return std::max(round + std::chrono::duration_cast<Clock::duration>(interval), Clock::now());
}

// Stores what a check found, and tells whether that is the beginning of something unwise to fail over in.
bool storeFlag(std::atomic<bool>& flag, bool found) {
    return !flag.exchange(found) && found;
}

}  // namespace

Host::Host(const Options& options) : _options(options), _control(options.socket) {
    drbdIF(_options.interface);
    localIP(_options.localIp);
    remoteIP(_options.remoteIp);
    _control.setStatus(&_status);
}

int Host::run() {
    const sigset_t signals = handledSignals();
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);  // inherited by the threads: only waitForStop takes them
    setUpInterruption();

    if (!_control.listen()) {
        std::cerr << "ternhad: cannot bind the control socket " << _options.socket << ": "
                  << std::strerror(errno) << "\n";
        return 1;
    }
    HA_LOG("Started on " + _options.localIp + ", peer " + _options.remoteIp);
    for (const auto body : {&Host::servePeer, &Host::serveControl, &Host::watchPeer, &Host::askPeer,
                            &Host::checkSelf, &Host::measureLink, &Host::keepLogs}) {
        startThread(body);
    }
    notifyReady();
    waitForStop();
    notifyStopping();
    attempt([] { HA_LOG("Stopping"); });
    stopThreads();
    unlink(_options.socket.c_str());
    return _exitCode;
}

void Host::startThread(void (Host::*body)()) {
    std::promise<void> promise;
    std::future<void> end = promise.get_future();
    // An exception that is left over ends the process: a daemon without one of its threads would only seem to
    // work.
    std::thread thread([this, body, done = std::move(promise)]() mutable noexcept {
        (this->*body)();
        done.set_value();
    });
    _workers.push_back({std::move(thread), std::move(end)});
}

void Host::waitForStop() {
    const sigset_t signals = handledSignals();
    const std::optional<std::chrono::microseconds> watchdog = watchdogInterval();
    for (;;) {
        int signal = 0;
        if (watchdog) {
            // A thread may miss a period, because the server's pass takes 30 seconds, but not the whole
            // interval.
            signal = waitForSignal(signals, *watchdog / 4);
        } else {
            sigwait(&signals, &signal);
        }
        if (signal == SIGTERM || signal == SIGINT) {
            break;
        }
        if (signal == SIGHUP) {
            const std::lock_guard<std::mutex> lock(_mutex);
            _isRotationRequested = true;
            _wakeUp.notify_all();
        }
        if (watchdog) {
            tellWatchdog();
        }
    }
}

void Host::tellWatchdog() {
    if (_peerAnswers > 0 && _peerQuestions > 0 && _selfChecks > 0) {
        _peerAnswers = 0;
        _peerQuestions = 0;
        _selfChecks = 0;
        notifyAlive();
    }
}

void Host::stopThreads() {
    stop(_exitCode);
    // A thread may be about to wait when a signal reaches it: they are sent until it has ended.
    const auto deadline = Clock::now() + STOP_LIMIT;
    for (Worker& worker : _workers) {
        while (worker.end.wait_for(STOP_STEP) != std::future_status::ready) {
            if (Clock::now() > deadline) {
                attempt(moveLogs);
                unlink(_options.socket.c_str());
                _exit(_exitCode);
            }
            attempt(interruptThreads);
        }
        worker.thread.join();
    }
    attempt(moveLogs);
}

void Host::stop(int exitCode) {
    const std::lock_guard<std::mutex> lock(_mutex);
    _exitCode = exitCode;
    _isStopping = true;
    _wakeUp.notify_all();
}

bool Host::sleepUntil(Clock::time_point time) {
    std::unique_lock<std::mutex> lock(_mutex);
    return !_wakeUp.wait_until(lock, time, [this] { return isStopping(); });
}

void Host::servePeer() {
    SocketServer server;
    Passes passes;
    while (!isStopping()) {
        passes.run([this, &server] {
            if (!server(_status)) {
                std::cerr << "ternhad: cannot answer the peer on " << _options.localIp
                          << ", the daemon log tells why\n";
                stop(1);
                kill(getpid(), SIGTERM);
            }
            ++_peerAnswers;
        });
    }
}

void Host::serveControl() {
    Passes passes;
    while (!isStopping()) {
        passes.run([this] { _control.serve(); });
    }
}

void Host::watchPeer() {
    Liveness liveness;
    Passes passes;
    auto next = Clock::now();
    do {
        passes.run([this, &liveness] { watchPeerOnce(liveness); });
        // A dead peer has cost more than an interval already and is asked again at once.
        next = nextRound(next, _options.checkInterval);
    } while (sleepUntil(next));
}

void Host::watchPeerOnce(Liveness& liveness) {
    const bool wasAlive = _status.isRemoteAlive();
    const bool isAlive = liveness.ask(wasAlive, [this] { return isStopping(); });
    if (isStopping()) {
        return;
    }
    _status.setRemoteAlive(isAlive);
    ++_peerQuestions;
    if (isAlive && !wasAlive) {
        const std::lock_guard<std::mutex> lock(_mutex);
        _hasPeerAppeared = true;
        _wakeUp.notify_all();
    } else if (wasAlive && !isAlive) {
        _isHostnameKnown = false;
        requestSnapshot();
    }
}

void Host::askPeer() {
    Passes passes;
    auto next = Clock::now();
    while (!isStopping()) {
        passes.run([this] {
            if (_status.isRemoteAlive()) {  // a dead one would only be waited for
                askForDisks();
                askForResync();
                askForHostname();
            }
        });
        next = nextRound(next, _options.checkInterval);
        std::unique_lock<std::mutex> lock(_mutex);
        _wakeUp.wait_until(lock, next, [this] { return isStopping() || _hasPeerAppeared; });
        _hasPeerAppeared = false;
    }
}

void Host::askForDisks() {
    const Json::Value unread("unread");
    Json::Value disks = unread;
    const auto start = Clock::now();
    const bool isHandling = TERN::HA::Daemon::IsRemoteDiskErrHandling()(disks);
    if (isStopping() || Clock::now() - start >= ANSWER_LIMIT) {
        return;
    }
    const bool isRead = disks != unread;
    if (isRead) {
        _status.setErrHandlingDiskRemote(disks);
    }
    // A report that cannot be read was cut, because it has more disks than a datagram holds.
    if (storeFlag(_status.isRemoteDiskErrHandling, isHandling || !isRead)) {
        requestSnapshot();
    }
}

void Host::askForResync() {
    const auto start = Clock::now();
    const bool isResync = TERN::HA::Daemon::IsRemoteMDResync()();
    if (isStopping() || Clock::now() - start >= ANSWER_LIMIT) {
        return;
    }
    // A question that could not be asked and "no resync" look alike: the end is believed when it is told
    // twice.
    if (storeFlag(_status.isRemoteMDResync, isResync || _wasPeerResync)) {
        requestSnapshot();
    }
    _wasPeerResync = isResync;
}

void Host::askForHostname() {
    if (_isHostnameKnown || isStopping()) {
        return;
    }
    std::string hostname;
    _isHostnameKnown = TERN::HA::Daemon::GetRemoteHostname()(hostname);
    if (_isHostnameKnown) {
        HA_LOG("Remote hostname is " + withoutLineEnd(hostname));
    }
}

void Host::checkSelf() {
    Passes passes;
    auto next = Clock::now();
    do {
        passes.run([this] { checkSelfOnce(); });
        next = nextRound(next, _options.checkInterval);
    } while (sleepUntil(next));
}

void Host::checkSelfOnce() {
    _status.isDRBDConnect = TERN::HA::Daemon::isDRBDConnect();

    const bool hasResyncBegun = storeFlag(_status.isMDResync, TERN::HA::Daemon::isMDResync());

    Json::Value disks(Json::arrayValue);
    const bool isHandling = TERN::HA::Daemon::isDiskErrHandling(disks);
    _status.setErrHandlingDisk(disks);
    const bool hasHandlingBegun = storeFlag(_status.isDiskErrHandling, isHandling);

    if (hasResyncBegun || hasHandlingBegun) {
        requestSnapshot();
    }
    ++_selfChecks;
}

void Host::measureLink() {
    TERN::HA::Daemon::InterfaceChecker interface;
    Passes passes;
    auto next = Clock::now();
    do {
        passes.run([this, &interface] { measureLinkOnce(interface); });
        next = nextRound(next, _options.heartbeatInterval);
    } while (sleepUntil(next));
}

void Host::measureLinkOnce(TERN::HA::Daemon::InterfaceChecker& interface) {
    float rate = 0;
    if (interface.networkNonOkRate(rate)) {
        _status.heartbeatPacketFailRate = rate;
    }
    // A ping that nobody answers takes 10 seconds and tells nothing new.
    const float latency = _status.isRemoteAlive() ? TERN::HA::Daemon::heartbeatLatency() : 0;
    if (!isStopping()) {
        _status.heartbeatLatency = latency;
    }
}

void Host::keepLogs() {
    const auto logInterval = std::chrono::duration_cast<Clock::duration>(_options.logInterval);
    const auto snapshotInterval = std::chrono::duration_cast<Clock::duration>(_options.snapshotInterval);
    LogKeeper daemonKeeper(*daemonLog, _options.rotateSize);
    LogKeeper recordKeeper(*recordLog, _options.rotateSize);
    Passes passes;
    auto nextMove = Clock::now() + logInterval;
    auto nextSnapshot = Clock::now();
    while (!isStopping()) {
        bool rotateNow = false;
        bool snapshotNow = false;
        {
            std::unique_lock<std::mutex> lock(_mutex);
            _wakeUp.wait_until(lock, std::min(nextMove, nextSnapshot), [this] {
                return isStopping() || _isRotationRequested || _isSnapshotRequested;
            });
            std::swap(rotateNow, _isRotationRequested);
            std::swap(snapshotNow, _isSnapshotRequested);
        }
        if (isStopping()) {
            return;
        }
        if (snapshotNow || Clock::now() >= nextSnapshot) {
            passes.run([this] {
                TERN::HA::Daemon::recordStatus(_status);
                TERN::HA::Daemon::recordPS();
                TERN::HA::Daemon::recordDF();
                TERN::HA::Daemon::recordMemoryInfo();
            });
            nextSnapshot = Clock::now() + snapshotInterval;
        }
        if (rotateNow || Clock::now() >= nextMove) {
            passes.run([&daemonKeeper, &recordKeeper, rotateNow] {
                daemonKeeper.move(rotateNow);
                recordKeeper.move(rotateNow);
            });
            nextMove = Clock::now() + logInterval;
        }
    }
}

void Host::requestSnapshot() {
    const std::lock_guard<std::mutex> lock(_mutex);
    _isSnapshotRequested = true;
    _wakeUp.notify_all();
}

}  // namespace ternhad
