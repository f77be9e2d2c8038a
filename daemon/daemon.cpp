#include "daemon.h"

#include <poll.h>
#include <pthread.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <exception>
#include <iostream>
#include <string>

#include "checker.h"
#include "directories.h"
#include "env_check.h"
#include "journal.h"
#include "memory.h"
#include "passes.h"
#include "service_notifier.h"

namespace ternhad {

namespace {

// A flag is stale after three rounds of its check plus the timeouts of two requests.
constexpr auto LOST_REPLIES = std::chrono::seconds(6);

// Shares of the 2 seconds that a stop may take.
constexpr auto THREADS_LIMIT = std::chrono::milliseconds(1000);
constexpr auto EVENTS_LIMIT = std::chrono::milliseconds(1200);
constexpr auto LOGS_LIMIT = std::chrono::milliseconds(1800);

// Block the signals in this thread and all that it starts; return a descriptor to read them from.
int openSignals() {
    sigset_t signals;
    sigemptyset(&signals);
    for (const int signal : {SIGTERM, SIGINT, SIGHUP, SIGCHLD}) {
        sigaddset(&signals, signal);
    }
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    return signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK);
}

bool complain(const std::string& what, int error) {
    std::cerr << "ternhad: cannot " << what << ": " << std::strerror(error) << '\n';
    return false;
}

}  // namespace

Daemon::Daemon(const Options& options, InstanceLock& lock)
    : _options(options),
      _lock(lock),
      _health(_events, std::chrono::duration_cast<Clock::duration>(3 * options.checkInterval) + LOST_REPLIES),
      _logKeeper(options, _health, _events),
      _reboot(_events, _shutdown),
      _peerServer(_health, _events, _reboot, _shutdown, _progress),
      _prober(options, _health, _events, _shutdown, _progress),
      _reporter(options, _health),
      _streams(_health.transitions(), _reporter, _shutdown),
      _controlServer(options.socket, socketDirectoryMode(options), ControlServer::Access::all, _health,
                     _reporter, _streams, _events, _shutdown),
      _announcer(_health, _shutdown),
      _notifier(options, _health, _events, _shutdown),
      _peerWatcher(options, _health, _events, _shutdown),
      _nodeWatcher(options, _health, _events, _shutdown, _progress),
      _watchdog(watchdogInterval()),
      _nextWatchdog(Clock::now()) {
    // Create the events here, not in startStatusServer(): the probes thread sets them, and its
    // descriptor table has only descriptors opened before it.
    if (!options.statusSocket.empty()) {
        _statusStreams.emplace(_health.transitions(), _reporter, _shutdown);
        _statusServer.emplace(options.statusSocket, STATUS_DIRECTORY_MODE, ControlServer::Access::reading,
                              _health, _reporter, *_statusStreams, _events, _shutdown);
        _statusServer->listener().shareWith(options.statusGroupId);
    }
    drbdIF(options.interface);
    localIP(options.localIp);
    remoteIP(options.remoteIp);
    replacePeerChecks(_reboot, _health);
}

int Daemon::run() {
    const int signals = openSignals();
    if (!_logKeeper.start()) {
        complain("start the log keeper", errno);
        return 1;
    }
    _health.setHostname(TERN::HA::Daemon::getLocalHostname());
    if (!startThreads()) {
        _shutdown.request(1);
        return stop();
    }
    lockUsedMemory();
    TERNHAD_LOG(_events, "Started on " + _options.localIp + ", peer " + _options.remoteIp);
    notifyReady();
    waitForStop(signals);
    notifyStopping();
    TERNHAD_LOG(_events, "Stopping");
    const int exitCode = stop();
    close(signals);
    return exitCode;
}

bool Daemon::startThreads() try {
    _eventThread.start("events", [this] { _events.run(); });
    if (!startPeerThreads()) {
        return false;
    }
    if (!_controlServer.listener().listen()) {
        return complain("bind the control socket " + _options.socket, errno);
    }
    _threads.start("reboot", [this] { _reboot.flush(); });
    _threads.start("orders", [this] { _controlServer.runOrders(); });
    _threads.start("streams", [this] { _streams.run(); });
    _threads.start("journal", [this] { _announcer.run(); });
    if (!_options.notify.empty()) {
        _threads.start("notify", [this] { _notifier.run(); });
    }
    _threads.start("peer", [this] { _peerWatcher.run(); });
    _threads.start("checks", [this] { _nodeWatcher.runChecks(); });
    _threads.start("link", [this] { _nodeWatcher.runMeasurements(); });
    // Last: a daemon that replies runs completely.
    startStatusServer();
    _threads.start("clients", [this] { _controlServer.run(&_progress); });
    return true;
} catch (const std::exception& error) {
    std::cerr << "ternhad: cannot start its threads: " << error.what() << '\n';
    return false;
}

// The daemon continues without this server, which retries until it has its socket. Its limits are
// separate, so that its clients cannot exhaust those of root.
void Daemon::startStatusServer() {
    if (!_statusServer) {
        return;
    }
    if (!_statusServer->listener().listen()) {
        writeJournal(Level::warning, "cannot bind the status socket " + _options.statusSocket + ": " +
                                         std::strerror(errno) + "; trying again");
    }
    _threads.start("readers", [this] { _statusServer->run(nullptr); });
    _threads.start("reader-streams", [this] { _statusStreams->run(); });
}

bool Daemon::startPeerThreads() {
    _threads.start("replies", [this] { _peerServer.run(); });
    if (const int error = _peerServer.waitForStart()) {
        return complain("serve the peer on " + _options.localIp, error);
    }
    if (_peerServer.isIsolated()) {
        _lock.handOver();  // that thread holds it, too
    }
    _threads.start("probes", [this] { _prober.run(); });
    if (const int error = _prober.waitForStart()) {
        return complain("probe the peer", error);
    }
    return true;
}

void Daemon::waitForStop(int signals) {
    Passes passes;
    while (!_shutdown.isRequested()) {
        passes.run([this] {
            if (_health.snapshotWanted().take()) {
                _logKeeper.wantSnapshot();
            }
            _logKeeper.work();
        });
        updateWatchdog();
        auto end = _logKeeper.workTime();
        if (_watchdog) {
            end = std::min(end, _nextWatchdog);
        }
        std::array<pollfd, 3> waits = {
            {{signals, POLLIN, 0}, {_logKeeper.fd(), POLLIN, 0}, {_health.snapshotWanted().fd(), POLLIN, 0}}};
        pollUntil(end, waits.data(), waits.size());
        takeSignals(signals);
    }
}

void Daemon::takeSignals(int signals) {
    signalfd_siginfo signal = {};
    while (read(signals, &signal, sizeof signal) == sizeof signal) {
        if (signal.ssi_signo == SIGTERM || signal.ssi_signo == SIGINT) {
            _shutdown.request(0);
        } else if (signal.ssi_signo == SIGHUP) {
            _logKeeper.wantRotation();
        }
    }
}

void Daemon::updateWatchdog() {
    // A thread may make no progress for a quarter of the interval, because it blocks for up to 30
    // seconds, but not for all of it.
    if (_watchdog && Clock::now() >= _nextWatchdog) {
        _nextWatchdog = Clock::now() + *_watchdog / 4;
        if (_progress.isComplete()) {
            notifyAlive();
        }
    }
}

int Daemon::stop() {
    const auto now = Clock::now();
    const bool haveEnded = _threads.join(now + THREADS_LIMIT);
    _events.end();
    const bool isWritten = _eventThread.join(now + EVENTS_LIMIT);
    _logKeeper.finish(now + LOGS_LIMIT);
    _controlServer.listener().removeFile();
    if (_statusServer) {
        _statusServer->listener().removeFile();
    }
    if (!haveEnded || !isWritten) {
        _exit(_shutdown.exitCode());  // without joining hung threads
    }
    return _shutdown.exitCode();
}

}  // namespace ternhad
