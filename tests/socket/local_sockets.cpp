#include "socket/local_sockets.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <cerrno>
#include <csignal>
#include <system_error>
#include <utility>

namespace test {

namespace {

int newSocket(int flags = 0) {
    return socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | flags, 0);
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
    RawClient{_path};
    _thread.join();
}

RawClient::RawClient(const std::string& path, int flags) : _fd(newSocket(flags), "socket") {
    const sockaddr_un address = addressOf(path);
    check(connect(_fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), "connect");
}

bool RawClient::send(const std::string& bytes) const {
    return ::send(_fd.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
}

std::string RawClient::receiveAll() const {
    std::string all;
    char buffer[8192];
    ssize_t count = 0;
    while ((count = recv(_fd.get(), buffer, sizeof buffer, 0)) > 0) {
        all.append(buffer, static_cast<std::size_t>(count));
    }
    return all;
}

void RawClient::finish() const {
    check(shutdown(_fd.get(), SHUT_WR), "shutdown");
}

void RawClient::close() {
    _fd.reset();
}

std::string exchange(const std::string& request) {
    const RawClient client;
    client.send(request);
    return client.receiveAll();
}

SilentServer::SilentServer(const std::string& path) : _fd(newSocket(), "socket") {
    const sockaddr_un address = addressOf(path);
    check(bind(_fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), "bind");
    check(listen(_fd.get(), 10), "listen");
}

std::string SilentServer::received() const {
    const Descriptor client(accept4(_fd.get(), nullptr, nullptr, SOCK_CLOEXEC), "accept");
    std::string bytes(8192, '\0');
    const ssize_t count = recv(client.get(), bytes.data(), bytes.size(), 0);
    bytes.resize(count > 0 ? static_cast<std::size_t>(count) : 0);
    return bytes;
}

void SilentServer::dropRequest() const {
    const Descriptor client(accept4(_fd.get(), nullptr, nullptr, SOCK_CLOEXEC), "accept");
    char first = 0;
    recv(client.get(), &first, 1, MSG_PEEK);
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
