#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstddef>
#include <optional>
#include <string>
#include <vector>

#include "control.h"
#include "event.h"
#include "event_streams.h"
#include "events.h"
#include "health.h"
#include "progress.h"
#include "report.h"

namespace ternhad {

// Serves the clients of the control socket side by side, up to 16 at a time. An order to reboot the peer,
// which takes up to 33 seconds, blocks only its own client; a second one meanwhile is refused.
class ControlServer {
 public:
    enum class Access { all, reading };  // reading: no orders

    ControlServer(const std::string& path, Access access, Health& health, const Reporter& reporter,
                  EventStreams& streams, Events& events, const Shutdown& shutdown);
    ~ControlServer();

    ControlServer(const ControlServer&) = delete;
    ControlServer& operator=(const ControlServer&) = delete;

    // Makes the socket file, in place of one that a former daemon has left, and listens. False, with errno,
    // when that fails; EEXIST when something else than a socket has the name.
    bool listen();

    // Gives the socket file to a group, which may then connect. False with errno.
    bool shareWith(gid_t group);

    // Body of the thread that serves clients. Tells `progress` of each pass, if given.
    void run(Progress* progress);

    // Body of the thread that carries out orders.
    void runOrders();

    // Removes the socket file if it is still this server's.
    void removeFile() const;

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
        const Reporter& _reporter;
        Health* _orders;
    };

    // One that has not sent its request yet.
    struct Client {
        int fd;
        Clock::time_point deadline;
    };

    bool hasFile() const;
    void restoreFile();
    void close();
    void wait() const;
    void acceptClients();
    bool serve(const Client& client);
    bool share() const;
    void follow(int fd);
    void order(int fd);
    void carryOutOrder();

    std::string _path;
    Access _access;
    std::optional<gid_t> _group;
    Health& _health;
    EventStreams& _streams;
    Events& _events;
    const Shutdown& _shutdown;
    Endpoint _requests;  // one for each thread
    Endpoint _orders;

    int _listener = -1;
    dev_t _device = 0;  // of the socket file
    ino_t _inode = 0;
    std::vector<Client> _clients;
    bool _isFull = false;
    bool _isFileLost = false;

    Event _ordered;
    std::atomic<int> _orderer{-1};  // the client whose order is carried out
};

}  // namespace ternhad
