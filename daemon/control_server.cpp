#include "control_server.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "ha_log.h"

namespace ternhad {

namespace {

constexpr unsigned int CLIENT_TIMEOUT = 0;  // a client's; this end does not use it
constexpr timeval SILENCE_LIMIT = {5, 0};
constexpr int BACKLOG = 100;
constexpr int PAUSE = 1000;  // milliseconds

// Closes a client's connection, whatever serving it ended by.
class Connection {
 public:
    explicit Connection(int fd) : _fd(fd) {}
    ~Connection() { close(_fd); }

    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;

 private:
    int _fd;
};

}  // namespace

ControlServer::ControlServer(const std::string& path) : MonitordSocket(path, CLIENT_TIMEOUT), _path(path) {}

ControlServer::~ControlServer() {
    if (_listener >= 0) {
        close(_listener);
    }
}

bool ControlServer::listen() {
    _listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    _path.copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
    unlink(_path.c_str());  // left by a daemon that has gone
    return _listener >= 0 && bind(_listener, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 &&
           ::listen(_listener, BACKLOG) == 0;
}

void ControlServer::serve() {
    const int client = accept4(_listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (client < 0) {
        if (errno != EINTR) {
            HA_LOG(std::string("Failed to accept a client: ") + std::strerror(errno));
            poll(nullptr, 0, PAUSE);  // what is missing now is missing at once again
        }
        return;
    }
    const Connection connection(client);
    setsockopt(client, SOL_SOCKET, SO_RCVTIMEO, &SILENCE_LIMIT, sizeof SILENCE_LIMIT);
    _serverListen(client);
}

}  // namespace ternhad
