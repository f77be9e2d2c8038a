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

// Serves the clients of the control socket side by side, up to 16 at a time. An order to reboot the peer,
// which takes up to 33 seconds, blocks only its own client; a second one meanwhile is refused.
class ControlServer {
 public:
    enum class Access { all, reading };  // reading: no orders

    // `directoryMode`: see Listener.
    ControlServer(const std::string& path, mode_t directoryMode, Access access, Health& health,
                  const Reporter& reporter, EventStreams& streams, Events& events, const Shutdown& shutdown);
    ~ControlServer();

    ControlServer(const ControlServer&) = delete;
    ControlServer& operator=(const ControlServer&) = delete;

    // The socket. Have it listen before the threads run.
    Listener& listener() { return _listener; }

    // Body of the thread that serves clients. Tells `progress` of each pass, if given.
    void run(Progress* progress);

    // Body of the thread that carries out orders.
    void runOrders();

 private:
    class Endpoint : public TERN::HA::Daemon::MonitordSocket {
     public:
        // With `orders` it takes orders to reboot the peer, and clears there the mark of one that disobeyed.
        Endpoint(const std::string& path, const Reporter& reporter, Health* orders);

        // As documented for the base, and the report. Refuses an order that it does not take, whatever was
        // seen of the request before.
        bool serverHandle(const Json::Value& request, Json::Value& reply) override;

        // Serves the request that has come to `fd`.
        void serve(int fd) { _serverListen(fd); }

     private:
        bool hasGoneDown(Clock::time_point start) const;

        const Reporter& _reporter;
        Health* _orders;
    };

    // One that has not sent its request yet.
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
    std::atomic<int> _orderer{-1};  // the client whose order is carried out
};

}  // namespace ternhad
