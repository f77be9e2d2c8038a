#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>
#include <thread>
#include <vector>

#include "control.h"
#include "options.h"
#include "status.h"

namespace ternhad {

// The running daemon: the node's record and the threads that fill it and answer from it.
class Host {
 public:
    // Tells the library the three addresses. `options` outlives the host.
    explicit Host(const Options& options);

    // Binds the control socket, runs the threads until SIGTERM or SIGINT, ends them within 2 seconds and
    // moves the logs to disk. Returns the process's exit code: 0, or 1 when a socket could not be had.
    //
    // The calling thread takes SIGTERM, SIGINT and SIGHUP, which must not be blocked or handled elsewhere;
    // SIGUSR1 serves to interrupt the threads.
    int run();

 private:
    using Clock = std::chrono::steady_clock;

    void startThread(void (Host::*body)());
    void stopThreads();
    void waitForStop();

    // True when the daemon is ending: nothing that a check found from now on may be believed, because its
    // waits are cut short.
    bool isStopping() const { return _isStopping; }
    void stop(int exitCode);

    // Waits until `time` or the daemon's end. True while the daemon goes on.
    bool sleepUntil(Clock::time_point time);

    void servePeer();
    void serveControl();
    void runChecks();
    void checkLocal();
    void checkPeer();
    bool askForDisks();  // false when the answer may have been lost: life is to be asked about first
    void askForResync();
    void askForHostname();
    void measureLink();
    void keepLogs();

    // Asks keepLogs for a snapshot.
    void requestSnapshot();

    const Options& _options;
    TERN::HA::Daemon::Status _status;
    TERN::HA::Daemon::MonitordSocket _control;

    bool _isHostnameKnown = false;
    bool _wasPeerResync = false;
    int _unreadableReports = 0;

    std::atomic<bool> _isStopping{false};
    std::atomic<int> _exitCode{0};
    std::mutex _mutex;  // guards the two requests; the condition also announces the end
    std::condition_variable _wakeUp;
    bool _isRotationRequested = false;
    bool _isSnapshotRequested = false;

    struct Worker {
        std::thread thread;
        std::future<void> end;
    };
    std::vector<Worker> _workers;
};

}  // namespace ternhad
