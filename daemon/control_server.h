#pragma once

#include <atomic>
#include <cstddef>
#include <string>
#include <vector>

#include "control.h"
#include "event.h"
#include "event_streams.h"
#include "events.h"
#include "health.h"
#include "listener.h"
#include "progress.h"
#include "report.h"

namespace ternhad {

// Serves up to 16 clients of the control socket concurrently. A reboot request, which takes up to
// 33 seconds, blocks only its own client; a second one meanwhile is refused.
class ControlServer {
 public:
    enum class Access { all, reading };  // reading: no reboot requests

    // `directoryMode`: see Listener.
    ControlServer(const std::string& path, mode_t directoryMode, Access access, Health& health,
                  const Reporter& reporter, EventStreams& streams, Events& events, const Shutdown& shutdown);
    ~ControlServer();

    ControlServer(const ControlServer&) = delete;
    ControlServer& operator=(const ControlServer&) = delete;

    // The socket; must listen before the threads start.
    Listener& listener() { return _listener; }

    // Body of the thread that serves clients. Reports each pass to `progress` unless it is null.
    void run(Progress* progress);

    // Body of the thread that carries out reboot requests.
    void runOrders();

 private:
    class Endpoint : public TERN::HA::Daemon::MonitordSocket {
     public:
        // Accepts reboot requests if `orders` is not null, and clears NodeRebooting in it when the
        // peer was not rebooted.
        Endpoint(const std::string& path, const Reporter& reporter, Health* orders);

        // Handles the requests of the base class and the report. Refuses a reboot request if
        // `orders` is null, whatever was peeked of the request before.
        bool serverHandle(const Json::Value& request, Json::Value& reply) override;

        // Serve the request on `fd`.
        void serve(int fd) { _serverListen(fd); }

     private:
        bool hasGoneDown(Clock::time_point start) const;

        const Reporter& _reporter;
        Health* _orders;
    };

    // A client that has not sent its request yet.
    struct Client {
        int fd;
        Clock::time_point deadline;
    };

    void restoreFile();
    void wait() const;
    void acceptClients();
    bool serve(const Client& client);
    void follow(int fd);
    void order(int fd);
    void carryOutOrder();

    Listener _listener;
    Access _access;
    Health& _health;
    EventStreams& _streams;
    Events& _events;
    const Shutdown& _shutdown;
    Endpoint _requests;  // one for each thread
    Endpoint _orders;

    std::vector<Client> _clients;
    bool _isFull = false;
    bool _isFileLost = false;

    Event _ordered;
    std::atomic<int> _orderer{-1};  // client whose reboot request is in progress
};

}  // namespace ternhad
