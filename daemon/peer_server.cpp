#include "peer_server.h"

#include <fcntl.h>
#include <poll.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <memory>
#include <new>
#include <string>

#include "chkstate.h"
#include "env_check.h"
#include "threads.h"

namespace ternhad {

namespace {

constexpr auto LONGEST_WAIT = std::chrono::seconds(30);
constexpr int MOST_REQUESTS = 64;  // requests served before deadlines are checked
constexpr char REPLYING[] = "reply to the peer";

struct CheckDeleter {
    void operator()(EnvCheck* check) const {
// Checks have neither data members nor destructors, so the missing virtual destructor is harmless.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdelete-non-virtual-dtor"
        delete check;
#pragma GCC diagnostic pop
    }
};

}  // namespace

class PeerServer::Socket final : public HASocketCommServer {
 public:
    explicit Socket(const std::string& address) : HASocketCommServer(address) {
        if (!HasError()) {
            hasError = fcntl(sockFd, F_SETFL, O_NONBLOCK) != 0;
        }
    }

    int fd() const { return sockFd; }

    // Sender of the last request, to whom the next reply goes.
    sockaddr_in sender() const { return peerAddr; }
    void setSender(const sockaddr_in& address) { peerAddr = address; }
};

void PeerServer::run() noexcept {
    _isIsolated = isolateDescriptors();
    Socket socket(localIP(""));
    if (socket.HasError()) {
        _started.set_value(errno);
        return;
    }
    _started.set_value(0);
    raisePriority(Priority::replies);
    while (!_shutdown.isRequested()) {
        serve(socket);
        _progress.made(Progress::peerServer);
        wait(socket);
    }
}

void PeerServer::serve(Socket& socket) noexcept {
    if (_reboot.isOrdered() && !_reboot.complete()) {
        socket.setSender(_orderer);
        reply(socket, "");
    }
    std::string request;
    for (int count = 0; count < MOST_REQUESTS; ++count) {
        try {
            if (socket.Recv(request) < 0) {
                return;
            }
            serveOne(socket, request);
        } catch (const std::bad_alloc&) {
            reportTrouble(ENOMEM);
        }
    }
}

void PeerServer::serveOne(Socket& socket, const std::string& request) {
    const auto entry = CheckerFactory::opMap->find(request);
    if (entry == CheckerFactory::opMap->end()) {
        std::abort();  // a peer that speaks another protocol must not be taken for a working one
    }
    const std::unique_ptr<EnvCheck, CheckDeleter> check(entry->second());
    const std::string text = check->handle(_health.status());
    if (request == RebootCheck().getType()) {
        _orderer = socket.sender();  // gets a reply only if the reboot fails
    } else {
        reply(socket, text);
    }
}

void PeerServer::reply(Socket& socket, const std::string& text) noexcept {
    reportTrouble(socket.Send(text) == -1 ? errno : 0);
}

void PeerServer::reportTrouble(int error) noexcept {
    if ((error != 0) == _isInTrouble) {
        return;
    }
    _isInTrouble = error != 0;
    if (_isInTrouble) {
        _events.troubleBegan(REPLYING, error);
    } else {
        _events.troubleEnded(REPLYING);
    }
}

void PeerServer::wait(const Socket& socket) const noexcept {
    // A flush that ends after the request was dropped wakes no thread.
    const int flushed = _reboot.isOrdered() ? _reboot.flushed().fd() : -1;
    std::array<pollfd, 3> waits = {
        {{socket.fd(), POLLIN, 0}, {_shutdown.event().fd(), POLLIN, 0}, {flushed, POLLIN, 0}}};
    const auto limit = Clock::now() + LONGEST_WAIT;
    pollUntil(_reboot.isOrdered() ? _reboot.deadline() : limit, waits.data(), waits.size());
}

}  // namespace ternhad
