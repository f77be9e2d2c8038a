#include "socket/local_sockets.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <system_error>
#include <utility>

namespace test {

namespace {

int newSocket() {
    return socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
}

sockaddr_un addressOf(const std::string& path) {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    path.copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
    return address;
}

void check(int result, const char* what) {
    if (result != 0) {
        throw std::system_error(errno, std::generic_category(), what);
    }
}

void ignoreSignal(int) {}

}  // namespace

ServingThread::ServingThread(TERN::HA::Daemon::DaemonLocalSocket& server, std::string path)
    : _path(std::move(path)), _thread([this, &server] {
          while (!_isStopping) {
              server.serverListen();
          }
      }) {}

ServingThread::~ServingThread() {
    _isStopping = true;
    { const RawClient last(_path); }
    _thread.join();
}

RawClient::RawClient(const std::string& path) : _fd(newSocket()) {
    const sockaddr_un address = addressOf(path);
    check(connect(_fd, reinterpret_cast<const sockaddr*>(&address), sizeof address), "connect");
}

RawClient::~RawClient() {
    close();
}

bool RawClient::send(const std::string& bytes) const {
    return ::send(_fd, bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
}

std::string RawClient::receiveAll() const {
    std::string all;
    char buffer[8192];
    ssize_t count = 0;
    while ((count = recv(_fd, buffer, sizeof buffer, 0)) > 0) {
        all.append(buffer, static_cast<std::size_t>(count));
    }
    return all;
}

void RawClient::close() {
    if (_fd >= 0) {
        ::close(_fd);
        _fd = -1;
    }
}

std::string exchange(const std::string& request) {
    const RawClient client;
    client.send(request);
    return client.receiveAll();
}

SilentServer::SilentServer(const std::string& path) : _fd(newSocket()) {
    const sockaddr_un address = addressOf(path);
    check(bind(_fd, reinterpret_cast<const sockaddr*>(&address), sizeof address), "bind");
    check(listen(_fd, 10), "listen");
}

SilentServer::~SilentServer() {
    close(_fd);
}

Interruptions::Interruptions() {
    struct sigaction action = {};
    action.sa_handler = ignoreSignal;
    sigaction(SIGALRM, &action, nullptr);
    const itimerval interval = {{0, 20000}, {0, 20000}};
    setitimer(ITIMER_REAL, &interval, nullptr);
}

Interruptions::~Interruptions() {
    const itimerval none = {};
    setitimer(ITIMER_REAL, &none, nullptr);
}

NoDescriptors::NoDescriptors() : _limit() {
    check(getrlimit(RLIMIT_NOFILE, &_limit), "getrlimit");
    const rlimit none = {0, _limit.rlim_max};
    check(setrlimit(RLIMIT_NOFILE, &none), "setrlimit");
}

NoDescriptors::~NoDescriptors() {
    setrlimit(RLIMIT_NOFILE, &_limit);
}

}  // namespace test
