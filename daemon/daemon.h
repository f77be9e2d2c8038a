#pragma once

#include <chrono>
#include <optional>

#include "announcer.h"
#include "control_server.h"
#include "event.h"
#include "events.h"
#include "health.h"
#include "instance.h"
#include "log_keeper.h"
#include "node_watcher.h"
#include "notifier.h"
#include "options.h"
#include "peer_server.h"
#include "peer_watcher.h"
#include "prober.h"
#include "progress.h"
#include "reboot.h"
#include "threads.h"

namespace ternhad {

// The running daemon: owns its components and their threads; handles signals and the service
// manager's watchdog.
class Daemon {
 public:
    // Takes ownership of `lock`. `options` must outlive the daemon.
    Daemon(const Options& options, InstanceLock& lock);

    // Run until SIGTERM or SIGINT, then stop within 2 seconds, with the logs moved to disk. Returns
    // the exit code: 0, or 1 after a message on standard error if a socket or thread could not be
    // created.
    //
    // The calling thread handles SIGTERM, SIGINT, SIGHUP and SIGCHLD, which must not be handled
    // elsewhere; SIGUSR1 interrupts the threads.
    int run();

 private:
    bool startThreads();
    bool startPeerThreads();
    void startStatusServer();
    void waitForStop(int signals);
    void takeSignals(int signals);
    void updateWatchdog();
    int stop();

    const Options& _options;
    InstanceLock& _lock;
    Shutdown _shutdown;
    Events _events;
    Health _health;
    Progress _progress;
    LogKeeper _logKeeper;
    Reboot _reboot;
    PeerServer _peerServer;
    Prober _prober;
    Reporter _reporter;
    EventStreams _streams;
    ControlServer _controlServer;
    std::optional<EventStreams> _statusStreams;  // for the status socket, if configured
    std::optional<ControlServer> _statusServer;
    Announcer _announcer;
    Notifier _notifier;
    PeerWatcher _peerWatcher;
    NodeWatcher _nodeWatcher;
    Threads _threads;
    Threads _eventThread;  // stops last: the others record events

    std::optional<std::chrono::microseconds> _watchdog;
    Clock::time_point _nextWatchdog;
};

}  // namespace ternhad
