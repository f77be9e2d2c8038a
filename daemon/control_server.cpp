#include "control_server.h"

#include <json/value.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "client_request.h"
#include "passes.h"

namespace ternhad {

namespace {

constexpr unsigned int CLIENT_TIMEOUT = 0;  // of clients only
constexpr auto SILENCE_LIMIT = std::chrono::seconds(5);
constexpr auto ROUND = std::chrono::seconds(5);  // between two checks of the socket file
constexpr std::size_t MOST_CLIENTS = 16;
constexpr auto OBEYED = std::chrono::seconds(6);  // a rebooting peer stops replying by then
constexpr char RESTORING[] = "create the missing socket";
constexpr char ACCEPTING[] = "accept control clients";
constexpr char ORDER = 'R';  // the actions of requests
constexpr char REPORT = 'S';
constexpr char EVENTS = 'E';

const char* describe(Findings::OrderOutcome outcome) {
    switch (outcome) {
        case Findings::OrderOutcome::wentDown:
            return "it went down";
        case Findings::OrderOutcome::stillAnswers:
            return "it still answers, not rebooted";
        case Findings::OrderOutcome::wasDead:
            return "it was already dead";
        case Findings::OrderOutcome::none:
        case Findings::OrderOutcome::wasUnknown:
            break;
    }
    return "unknown, it had not replied yet";
}

}  // namespace

ControlServer::Endpoint::Endpoint(const std::string& path, const Reporter& reporter, Health* orders)
    : MonitordSocket(path, CLIENT_TIMEOUT), _reporter(reporter), _orders(orders) {}

bool ControlServer::Endpoint::serverHandle(const Json::Value& request, Json::Value& reply) {
    const char action = request.isObject() && request["act"].isString() ? request["act"].asString()[0] : '\0';
    if (action == REPORT) {
        reply = _reporter.report();
        return true;
    }
    if (action == ORDER && _orders == nullptr) {
        return false;
    }
    if (action != ORDER) {
        return MonitordSocket::serverHandle(request, reply);
    }
    const bool wasKnown = _orders->isPeerKnown();
    const bool wasAlive = _orders->isPeerAlive();
    const bool wasRebooting = _orders->status().isRemoteRebooting();
    const auto start = Clock::now();
    const bool isServed = MonitordSocket::serverHandle(request, reply);
    if (!wasAlive && !wasRebooting) {
        // A dead peer may not have received the request.
        _orders->status().delRemoteNodeState(TERN::HA::Daemon::NodeRebooting);
    }
    if (!wasAlive) {
        _orders->findings().setOrderOutcome(wasKnown ? Findings::OrderOutcome::wasDead
                                                     : Findings::OrderOutcome::wasUnknown);
    } else if (isServed && hasGoneDown(start)) {
        _orders->findings().setOrderOutcome(Findings::OrderOutcome::wentDown);
    } else {
        _orders->status().delRemoteNodeState(TERN::HA::Daemon::NodeRebooting);
        _orders->findings().setOrderOutcome(Findings::OrderOutcome::stillAnswers);
    }
    return isServed;
}

// The library has waited until the peer was dead, or for 30 seconds. With a long `dead-after`, a peer
// that went down is not dead yet: the time of its last reply counts.
bool ControlServer::Endpoint::hasGoneDown(Clock::time_point start) const {
    return !_orders->isPeerAlive() || _orders->findings().lastReplyTime() < start + OBEYED;
}

ControlServer::ControlServer(const std::string& path, mode_t directoryMode, Access access, Health& health,
                             const Reporter& reporter, EventStreams& streams, Events& events,
                             const Shutdown& shutdown)
    : _listener(path, directoryMode),
      _access(access),
      _health(health),
      _streams(streams),
      _events(events),
      _shutdown(shutdown),
      _requests(path, reporter, nullptr),
      _orders(path, reporter, &health) {
    _requests.setStatus(&health.status());
    _orders.setStatus(&health.status());
    _clients.reserve(MOST_CLIENTS);
}

ControlServer::~ControlServer() {
    for (const Client& client : _clients) {
        close(client.fd);
    }
}

void ControlServer::restoreFile() {
    if (_listener.hasFile()) {
        return;
    }
    const bool hadFile = _listener.hasHadFile();
    if (_listener.listen()) {
        if (hadFile) {
            TERNHAD_LOG(_events, "Recreated the socket " + _listener.path());
        } else {
            TERNHAD_LOG(_events, "Created the socket " + _listener.path());
        }
        _isFileLost = false;
    } else if (!_isFileLost) {
        _events.troubleBegan(RESTORING, errno);
        _isFileLost = true;
    }
}

void ControlServer::run(Progress* progress) {
    Passes passes;
    while (!_shutdown.isRequested()) {
        passes.run([this] {
            restoreFile();
            wait();
            const auto isDone = [this](const Client& client) { return serve(client); };
            _clients.erase(std::remove_if(_clients.begin(), _clients.end(), isDone), _clients.end());
            acceptClients();
        });
        if (progress != nullptr) {
            progress->made(Progress::controlServer);
        }
    }
}

void ControlServer::wait() const {
    std::array<pollfd, MOST_CLIENTS + 1> waits;  // one client less while more are accepted
    std::size_t count = 0;
    auto end = Clock::now() + ROUND;
    waits.at(count++) = {_shutdown.event().fd(), POLLIN, 0};
    for (const Client& client : _clients) {
        waits.at(count++) = {client.fd, POLLIN, 0};
        end = std::min(end, client.deadline);
    }
    if (_clients.size() < MOST_CLIENTS && !_isFull) {
        waits.at(count++) = {_listener.fd(), POLLIN, 0};
    }
    pollUntil(end, waits.data(), count);
}

void ControlServer::acceptClients() {
    const bool wasFull = std::exchange(_isFull, false);
    while (_listener.fd() >= 0 && _clients.size() < MOST_CLIENTS) {
        const int fd = accept4(_listener.fd(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
        if (fd < 0) {
            if (errno != EAGAIN && errno != EINTR && errno != ECONNABORTED) {
                _isFull = true;  // back off for a round: the failure would recur immediately
                if (!wasFull) {
                    _events.troubleBegan(ACCEPTING, errno);
                }
            } else if (wasFull) {
                _events.troubleEnded(ACCEPTING);
            }
            return;
        }
        _clients.push_back({fd, Clock::now() + SILENCE_LIMIT});
    }
}

// Serve the client if its request has arrived. Returns false while waiting for it.
bool ControlServer::serve(const Client& client) {
    pollfd state = {client.fd, POLLIN, 0};
    if (poll(&state, 1, 0) == 0 && Clock::now() < client.deadline) {
        return false;
    }
    if (state.revents != 0) {
        const char action = actionOf(client.fd);
        if (action == ORDER) {
            order(client.fd);
            return true;
        }
        if (action == EVENTS) {
            discardRequest(client.fd);
            follow(client.fd);
            return true;
        }
        _requests.serve(client.fd);
    }
    close(client.fd);
    return true;
}

// Turn the connection into an event stream.
void ControlServer::follow(int fd) {
    if (!_streams.add(fd)) {
        refuse(fd, "too many clients follow the events");
        close(fd);
    }
}

void ControlServer::order(int fd) {
    int nobody = -1;
    if (_access == Access::reading) {
        refuse(fd, "this socket is read-only");
    } else if (_orderer.compare_exchange_strong(nobody, fd)) {
        _ordered.set();
        return;
    } else {
        refuse(fd, "another reboot request is still in progress");
    }
    close(fd);
}

void ControlServer::runOrders() {
    Passes passes;
    while (_shutdown.sleepUntil(Clock::now() + std::chrono::hours(24), {&_ordered})) {
        if (_ordered.take()) {
            passes.run([this] { carryOutOrder(); });
            close(_orderer.exchange(-1));
        }
    }
}

void ControlServer::carryOutOrder() {
    std::string state = _health.isPeerKnown() ? "is dead" : "has not replied yet";
    if (_health.isPeerAlive()) {
        state = "is alive";
    }
    TERNHAD_LOG(_events, "Requesting a reboot of the peer, which " + state);
    _orders.serve(_orderer);
    if (_shutdown.isRequested()) {
        return;
    }
    TERNHAD_LOG(_events, std::string("Reboot of the peer: ") + describe(_health.findings().orderOutcome()));
}

}  // namespace ternhad
