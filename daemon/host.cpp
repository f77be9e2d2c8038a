#include "host.h"

#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <string>

#include "checker.h"
#include "env_check.h"
#include "ha_log.h"

namespace ternhad {

using TERN::HA::Daemon::DaemonLog;
using TERN::HA::Daemon::daemonLog;
using TERN::HA::Daemon::recordLog;

namespace {

constexpr unsigned int CONTROL_TIMEOUT = 0;  // the server side of the socket does not use it
constexpr auto STOP_LIMIT = std::chrono::milliseconds(1500);
constexpr auto STOP_STEP = std::chrono::milliseconds(20);

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

// Ends the programs that the daemon's threads wait for: ping alone may take 10 seconds.
void endChildren() {
    std::error_code error;
    for (const auto& task : std::filesystem::directory_iterator("/proc/self/task", error)) {
        std::ifstream children(task.path() / "children");
        pid_t child = 0;
        while (children >> child) {
            kill(child, SIGTERM);
        }
    }
}

std::string withoutLineEnd(std::string text) {
    while (!text.empty() && (text.back() == '\n' || text.back() == '\r')) {
        text.pop_back();
    }
    return text;
}

void moveToDisk(DaemonLog& log, std::int64_t rotateSize) {
    log.writeLogToDisk();
    if (log.size() >= rotateSize) {
        log.rotate();
    }
}

// Stores what a check found, and tells whether that is the beginning of something unwise to fail over in.
bool storeFlag(std::atomic<bool>& flag, bool found) {
    return !flag.exchange(found) && found;
}

}  // namespace

Host::Host(const Options& options) : _options(options), _control(options.socket, CONTROL_TIMEOUT) {
    drbdIF(_options.interface);
    localIP(_options.localIp);
    remoteIP(_options.remoteIp);
    _control.setStatus(&_status);
}

int Host::run() {
    const sigset_t signals = handledSignals();
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);  // inherited by the threads: only waitForStop takes them
    setUpInterruption();

    if (_control.hasError() || !_control.serverBind()) {
        std::cerr << "ternhad: cannot bind the control socket " << _options.socket
                  << ", the system log tells why\n";
        return 1;
    }
    HA_LOG("Started on " + _options.localIp + ", peer " + _options.remoteIp);
    for (const auto body :
         {&Host::servePeer, &Host::serveControl, &Host::runChecks, &Host::measureLink, &Host::keepLogs}) {
        startThread(body);
    }
    waitForStop();
    HA_LOG("Stopping");
    stopThreads();
    unlink(_options.socket.c_str());
    return _exitCode;
}

void Host::startThread(void (Host::*body)()) {
    std::promise<void> promise;
    std::future<void> end = promise.get_future();
    // An exception ends the process: a daemon without one of its threads would only seem to work.
    std::thread thread([this, body, done = std::move(promise)]() mutable noexcept {
        (this->*body)();
        done.set_value();
    });
    _workers.push_back({std::move(thread), std::move(end)});
}

void Host::waitForStop() {
    const sigset_t signals = handledSignals();
    for (;;) {
        int signal = 0;
        sigwait(&signals, &signal);
        if (signal != SIGHUP) {
            break;
        }
        const std::lock_guard<std::mutex> lock(_mutex);
        _isRotationRequested = true;
        _wakeUp.notify_all();
    }
}

void Host::stopThreads() {
    stop(_exitCode);
    // A thread may be about to wait when a signal reaches it: they are sent until it has ended.
    const auto deadline = Clock::now() + STOP_LIMIT;
    for (Worker& worker : _workers) {
        while (worker.end.wait_for(STOP_STEP) != std::future_status::ready) {
            if (Clock::now() > deadline) {
                daemonLog->writeLogToDisk();
                recordLog->writeLogToDisk();
                unlink(_options.socket.c_str());
                _exit(_exitCode);
            }
            endChildren();
            pthread_kill(worker.thread.native_handle(), SIGUSR1);
        }
        worker.thread.join();
    }
    daemonLog->writeLogToDisk();
    recordLog->writeLogToDisk();
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
    while (!isStopping()) {
        if (!server(_status)) {
            std::cerr << "ternhad: cannot answer the peer on " << _options.localIp
                      << ", the daemon log tells why\n";
            stop(1);
            kill(getpid(), SIGTERM);
        }
    }
}

void Host::serveControl() {
    while (!isStopping()) {
        _control.serverListen();
    }
}

void Host::runChecks() {
    auto next = Clock::now();
    do {
        checkLocal();
        checkPeer();
        // A dead peer has cost more than an interval already and is asked again at once.
        next = std::max(next + std::chrono::duration_cast<Clock::duration>(_options.checkInterval),
                        Clock::now());
    } while (sleepUntil(next));
}

void Host::checkLocal() {
    _status.isDRBDConnect = TERN::HA::Daemon::isDRBDConnect();

    const bool hasResyncBegun = storeFlag(_status.isMDResync, TERN::HA::Daemon::isMDResync());

    Json::Value disks(Json::arrayValue);
    const bool isHandling = TERN::HA::Daemon::isDiskErrHandling(disks);
    _status.setErrHandlingDisk(disks);
    const bool hasHandlingBegun = storeFlag(_status.isDiskErrHandling, isHandling);

    if (hasResyncBegun || hasHandlingBegun) {
        requestSnapshot();
    }
}

void Host::checkPeer() {
    const bool wasAlive = _status.isRemoteAlive();
    const bool isAlive = TERN::HA::Daemon::IsRemoteAlive()();
    if (isStopping()) {
        return;
    }
    _status.setRemoteAlive(isAlive);
    if (!isAlive) {
        _isHostnameKnown = false;
        if (wasAlive) {
            requestSnapshot();
        }
        return;  // other questions would only delay the next one for life
    }

    if (!askForDisks() || isStopping()) {
        return;
    }
    askForResync();
    if (!_isHostnameKnown && !isStopping()) {
        askForHostname();
    }
}

bool Host::askForDisks() {
    const Json::Value unanswered("unanswered");
    Json::Value disks = unanswered;
    const bool isHandling = TERN::HA::Daemon::IsRemoteDiskErrHandling()(disks);
    if (isStopping()) {
        return false;
    }
    bool hasBegun = false;
    if (disks != unanswered) {
        _unreadableReports = 0;
        _status.setErrHandlingDiskRemote(disks);
        hasBegun = storeFlag(_status.isRemoteDiskErrHandling, isHandling);
    } else if (++_unreadableReports > 1) {
        // Alive in between, so that this is no lost answer: the report was cut because it has more disks than
        // a datagram holds.
        hasBegun = storeFlag(_status.isRemoteDiskErrHandling, true);
    }
    if (hasBegun) {
        requestSnapshot();
    }
    return _unreadableReports != 1;
}

void Host::askForResync() {
    const bool isResync = TERN::HA::Daemon::IsRemoteMDResync()();
    if (isStopping()) {
        return;
    }
    // No answer and "no resync" look alike: the end of a resync is believed when it is told twice.
    if (storeFlag(_status.isRemoteMDResync, isResync || _wasPeerResync)) {
        requestSnapshot();
    }
    _wasPeerResync = isResync;
}

void Host::askForHostname() {
    std::string hostname;
    _isHostnameKnown = TERN::HA::Daemon::GetRemoteHostname()(hostname);
    if (_isHostnameKnown) {
        HA_LOG("Remote hostname is " + withoutLineEnd(hostname));
    }
}

void Host::measureLink() {
    TERN::HA::Daemon::InterfaceChecker interface;
    auto next = Clock::now();
    do {
        float rate = 0;
        if (interface.networkNonOkRate(rate)) {
            _status.heartbeatPacketFailRate = rate;
        }
        // A ping that nobody answers takes 10 seconds and tells nothing new.
        const float latency = _status.isRemoteAlive() ? TERN::HA::Daemon::heartbeatLatency() : 0;
        if (isStopping()) {
            return;
        }
        _status.heartbeatLatency = latency;
        next = std::max(next + std::chrono::duration_cast<Clock::duration>(_options.heartbeatInterval),
                        Clock::now());
    } while (sleepUntil(next));
}

void Host::keepLogs() {
    const auto logInterval = std::chrono::duration_cast<Clock::duration>(_options.logInterval);
    const auto snapshotInterval = std::chrono::duration_cast<Clock::duration>(_options.snapshotInterval);
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
            TERN::HA::Daemon::recordStatus(_status);
            TERN::HA::Daemon::recordPS();
            TERN::HA::Daemon::recordDF();
            TERN::HA::Daemon::recordMemoryInfo();
            nextSnapshot = Clock::now() + snapshotInterval;
        }
        if (rotateNow || Clock::now() >= nextMove) {
            moveToDisk(*daemonLog, rotateNow ? 0 : _options.rotateSize);
            moveToDisk(*recordLog, rotateNow ? 0 : _options.rotateSize);
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
