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

// The running daemon: its parts and their threads, and what its manager and signals want of it.
class Daemon {
 public:
    // Takes over `lock`. `options` outlives the daemon.
    Daemon(const Options& options, InstanceLock& lock);

    // Runs until SIGTERM or SIGINT and ends within 2 seconds, with the logs moved to disk. Returns the exit
    // code: 0, or 1 after a message on standard error when a socket or thread could not be had.
    //
    // The calling thread takes SIGTERM, SIGINT, SIGHUP and SIGCHLD, which must not be handled elsewhere;
    // SIGUSR1 interrupts the threads.
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
    std::optional<EventStreams> _statusStreams;  // for monitoring without root
    std::optional<ControlServer> _statusServer;
    Announcer _announcer;
    Notifier _notifier;
    PeerWatcher _peerWatcher;
    NodeWatcher _nodeWatcher;
    Threads _threads;
    Threads _eventThread;  // ends last: the others record

    std::optional<std::chrono::microseconds> _watchdog;
    Clock::time_point _nextWatchdog;
};

}  // namespace ternhad
