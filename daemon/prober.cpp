#include "prober.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <new>

#include "checker.h"
#include "chkstate.h"
#include "threads.h"

namespace ternhad {

using TERN::HA::Daemon::IsRemoteAlive;

namespace {

constexpr unsigned int NO_TIMEOUT = 0;
constexpr int MOST_REPLIES = 64;  // datagrams read from one socket before the next one
constexpr char SENDING[] = "send liveness probes";

// Return true if a probe was not sent for lack of a local resource. Other errors, such as an
// unreachable network, look the same as a dead peer.
bool isOwnTrouble(int error) {
    switch (error) {
        case EAGAIN:
        case EMFILE:
        case ENFILE:
        case ENOBUFS:
        case ENOMEM:
            return true;
        default:
            return false;
    }
}

// After a failed receive: return true unless the queue is empty. Errors such as "port unreachable"
// are returned in place of a datagram.
bool isMoreExpected() {
    return errno != EAGAIN && errno != EBADF;
}

}  // namespace

// Socket of one probe at a time, each from a new port: the port matches a reply to its probe, and a
// reply later than the next probe is dropped.
class Prober::Socket final : public HASocketCommClient {
 public:
    explicit Socket(const std::string& address) : HASocketCommClient(address, NO_TIMEOUT) {
        if (!HasError()) {
            hasError = fcntl(sockFd, F_SETFL, O_NONBLOCK) != 0;
        }
    }

    int fd() const { return sockFd; }

    // Bind a new port, connected so that only the peer's datagrams and errors arrive. Returns false
    // with errno on failure.
    bool renew() const {
        sockaddr none = {};
        none.sa_family = AF_UNSPEC;
        if (connect(sockFd, &none, sizeof none) != 0) {
            return false;
        }
        discardOldReplies();
        return connect(sockFd, reinterpret_cast<const sockaddr*>(&peerAddr), sizeof peerAddr) == 0;
    }

 private:
    void discardOldReplies() const {
        std::array<char, 1> byte;
        while (recv(sockFd, byte.data(), byte.size(), 0) >= 0 || isMoreExpected()) {
        }
    }
};

Prober::Prober(const Options& options, Health& health, Events& events, const Shutdown& shutdown,
               Progress& progress)
    : _options(options),
      _health(health),
      _events(events),
      _shutdown(shutdown),
      _progress(progress),
      _request(IsRemoteAlive().getType()),
      _expectedReply(IsRemoteAlive().handle(health.status())) {}

Prober::~Prober() = default;

void Prober::run() noexcept {
    const auto toDuration = [](Seconds seconds) {
        return std::chrono::duration_cast<FailureDetector::Duration>(seconds);
    };
    isolateDescriptors();
    FailureDetector detector(toDuration(_options.checkInterval), toDuration(_options.deadAfter),
                             Clock::now());
    for (std::size_t i = 0; i < detector.capacity(); ++i) {
        _sockets.push_back(std::make_unique<Socket>(_options.remoteIp));
        if (_sockets.back()->HasError()) {
            const int error = errno;
            _sockets.clear();
            _started.set_value(error);
            return;
        }
    }
    _started.set_value(0);
    raisePriority(Priority::probes);
    while (!_shutdown.isRequested()) {
        // Read the time before the replies: all replies up to that time count in the decision.
        detector.wakeUp(Clock::now());
        receive(detector);
        if (detector.isPeerAlive() || detector.isPeerDead()) {
            _health.setPeerAlive(detector.isPeerAlive());
        }
        if (detector.isProbeDue()) {
            probe(detector);
        }
        _progress.made(Progress::prober);
        wait(detector);
    }
    _sockets.clear();  // they are open in this thread's descriptor table
}

void Prober::probe(FailureDetector& detector) noexcept {
    const int error = send(detector.nextProbe());
    const bool isInTrouble = isOwnTrouble(error);
    if (isInTrouble) {
        detector.probeNotSent();
    } else {
        detector.probeSent();
    }
    if (isInTrouble != _isInTrouble) {
        _isInTrouble = isInTrouble;
        if (isInTrouble) {
            _events.troubleBegan(SENDING, error);
        } else {
            _events.troubleEnded(SENDING);
        }
    }
}

// Return 0 or errno.
int Prober::send(std::size_t number) noexcept {
    Socket& socket = *_sockets[number];
    if (!socket.renew()) {
        return errno;
    }
    return socket.Send(_request) >= 0 ? 0 : errno;
}

void Prober::receive(FailureDetector& detector) noexcept {
    std::string reply;
    for (std::size_t i = 0; i < _sockets.size(); ++i) {
        try {
            for (int count = 0; count < MOST_REPLIES && detector.isAwaited(i); ++count) {
                reply.clear();
                if (_sockets[i]->Recv(reply) < 0 && !isMoreExpected()) {
                    break;
                }
                if (reply == _expectedReply) {
                    detector.replyReceived(i);
                    _health.peerReplied();
                }
            }
        } catch (const std::bad_alloc&) {
            continue;  // out of memory for a reply longer than the expected one
        }
    }
}

void Prober::wait(const FailureDetector& detector) const noexcept {
    static constexpr std::size_t MOST = 256;
    std::array<pollfd, MOST> waits;
    std::size_t count = 0;
    waits[count++] = {_shutdown.event().fd(), POLLIN, 0};
    for (std::size_t i = 0; i < _sockets.size() && count < MOST; ++i) {
        if (detector.isAwaited(i)) {
            waits[count++] = {_sockets[i]->fd(), POLLIN, 0};
        }
    }
    pollUntil(detector.wakeUpTime(), waits.data(), count);
}

}  // namespace ternhad
