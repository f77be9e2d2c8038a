#pragma once

#include <future>
#include <memory>
#include <string>
#include <vector>

#include "event.h"
#include "events.h"
#include "failure_detector.h"
#include "health.h"
#include "options.h"
#include "progress.h"

namespace ternhad {

// Sends the liveness probes and stores whether the peer is alive. Its thread blocks only on its own
// sockets: it opens no file, starts no program or thread, and logs through Events.
class Prober {
 public:
    Prober(const Options& options, Health& health, Events& events, const Shutdown& shutdown,
           Progress& progress);

    ~Prober();

    Prober(const Prober&) = delete;
    Prober& operator=(const Prober&) = delete;

    // Thread body.
    void run() noexcept;

    // Wait until the thread has opened its sockets. Returns 0, or errno on failure; the thread then
    // ends. To be called once.
    int waitForStart() { return _started.get_future().get(); }

 private:
    class Socket;

    void probe(FailureDetector& detector) noexcept;
    int send(std::size_t number) noexcept;
    void receive(FailureDetector& detector) noexcept;
    void wait(const FailureDetector& detector) const noexcept;

    const Options& _options;
    Health& _health;
    Events& _events;
    const Shutdown& _shutdown;
    Progress& _progress;

    std::promise<int> _started;
    std::string _request;
    std::string _expectedReply;
    std::vector<std::unique_ptr<Socket>> _sockets;
    bool _isInTrouble = false;
};

}  // namespace ternhad
