#pragma once

#include <netinet/in.h>

#include <future>
#include <string>

#include "event.h"
#include "events.h"
#include "health.h"
#include "progress.h"
#include "reboot.h"

namespace ternhad {

// Replies to the peer's requests. Its thread blocks only on its socket: it opens no file except the
// reboot trigger, and logs through Events.
class PeerServer {
 public:
    PeerServer(Health& health, Events& events, Reboot& reboot, const Shutdown& shutdown, Progress& progress)
        : _health(health), _events(events), _reboot(reboot), _shutdown(shutdown), _progress(progress) {}

    // Thread body. Binds localIP(""), port HA_PEER_PORT.
    void run() noexcept;

    // Wait until the thread has bound its port. Returns 0, or errno on failure; the thread then
    // ends. To be called once.
    int waitForStart() { return _started.get_future().get(); }

    // Whether the thread has its own descriptor table; valid after waitForStart().
    bool isIsolated() const noexcept { return _isIsolated; }

 private:
    class Socket;

    void serve(Socket& socket) noexcept;
    void serveOne(Socket& socket, const std::string& request);
    void reply(Socket& socket, const std::string& text) noexcept;
    void reportTrouble(int error) noexcept;
    void wait(const Socket& socket) const noexcept;

    Health& _health;
    Events& _events;
    Reboot& _reboot;
    const Shutdown& _shutdown;
    Progress& _progress;
    std::promise<int> _started;
    bool _isIsolated = false;
    sockaddr_in _orderer = {};  // who requested the reboot
    bool _isInTrouble = false;
};

}  // namespace ternhad
