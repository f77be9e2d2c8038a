#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>
#include <thread>
#include <vector>

#include "checker.h"
#include "control_server.h"
#include "liveness.h"
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
    void tellWatchdog();

    // True when the daemon is ending: nothing that a check found from now on may be believed, because its
    // waits are cut short.
    bool isStopping() const { return _isStopping; }
    void stop(int exitCode);

    // Waits until `time` or the daemon's end. True while the daemon goes on.
    bool sleepUntil(Clock::time_point time);

    // The threads. Each waits for nothing that another one is for: a program, a disk or a peer that is slow
    // to answer must not delay the question for life.
    void servePeer();
    void serveControl();
    void watchPeer();
    void askPeer();
    void checkSelf();
    void measureLink();
    void keepLogs();

    void watchPeerOnce(Liveness& liveness);
    void checkSelfOnce();
    void measureLinkOnce(TERN::HA::Daemon::InterfaceChecker& interface);
    void askForDisks();
    void askForResync();
    void askForHostname();

    // Asks keepLogs for a snapshot.
    void requestSnapshot();

    const Options& _options;
    TERN::HA::Daemon::Status _status;
    ControlServer _control;

    std::atomic<bool> _isHostnameKnown{false};
    bool _wasPeerResync = false;

    // Passes of the threads that the watchdog watches, counted since it was told last.
    std::atomic<unsigned int> _peerAnswers{0};
    std::atomic<unsigned int> _peerQuestions{0};
    std::atomic<unsigned int> _selfChecks{0};

    std::atomic<bool> _isStopping{false};
    std::atomic<int> _exitCode{0};
    std::mutex _mutex;  // guards the requests; the condition also announces the end
    std::condition_variable _wakeUp;
    bool _hasPeerAppeared = false;
    bool _isRotationRequested = false;
    bool _isSnapshotRequested = false;

    struct Worker {
        std::thread thread;
        std::future<void> end;
    };
    std::vector<Worker> _workers;
};

}  // namespace ternhad
