#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstddef>
#include <string>
#include <vector>

#include "control.h"
#include "event.h"
#include "events.h"
#include "health.h"
#include "progress.h"

namespace ternhad {

// Serves the clients of the control socket side by side, up to 16 at a time. An order to reboot the peer,
// which takes up to 33 seconds, blocks only its own client; a second one meanwhile is refused.
class ControlServer {
 public:
    ControlServer(const std::string& path, Health& health, Events& events, const Shutdown& shutdown,
                  Progress& progress);
    ~ControlServer();

    ControlServer(const ControlServer&) = delete;
    ControlServer& operator=(const ControlServer&) = delete;

    // Makes the socket file, in place of one that a former daemon has left, and listens. False, with errno,
    // when that fails; EEXIST when something else than a socket has the name.
    bool listen();

    // Body of the thread that serves clients.
    void run();

    // Body of the thread that carries out orders.
    void runOrders();

    // Removes the socket file if it is still this server's.
    void removeFile() const;

 private:
    class Endpoint : public TERN::HA::Daemon::MonitordSocket {
     public:
        using MonitordSocket::MonitordSocket;

        // Serves the request that has come to `fd`.
        void serve(int fd) { _serverListen(fd); }
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
    void order(int fd);

    std::string _path;
    Events& _events;
    const Shutdown& _shutdown;
    Progress& _progress;
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
