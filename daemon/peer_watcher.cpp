#include "peer_watcher.h"

#include <json/value.h>

#include <string>

#include "checker.h"
#include "passes.h"
#include "printable.h"

namespace ternhad {

using TERN::HA::Daemon::IsRemoteDiskErrHandling;
using TERN::HA::Daemon::IsRemoteMDResync;

namespace {

// A request that took as long as this got no reply, whatever its result. The library waits for 3 seconds.
constexpr auto REPLY_LIMIT = std::chrono::milliseconds(2900);

// Whether the last request of this thread had a socket to go out by. A check has no data members.
thread_local bool isSent = false;

// The library's check of the same type. It asks for the type once it has a socket: without one, the check's
// result is this node's trouble and tells nothing about the peer.
template <typename Check>
class Observed : public Check {
 public:
    std::string getType() override {
        isSent = true;
        return Check::getType();
    }
};

// Runs `request`. True when it got a reply.
template <typename Request>
bool exchange(const Request& request) {
    isSent = false;
    const auto start = Clock::now();
    request();
    return isSent && Clock::now() - start < REPLY_LIMIT;
}

}  // namespace

void PeerWatcher::run() {
    Passes passes;
    auto next = Clock::now();
    do {
        // It may be another machine that appears.
        if (_health.peerAppeared().take()) {
            _isHostnameKnown = false;
        }
        passes.run([this] {
            if (_health.isPeerAlive()) {  // a dead one would only be waited for
                requestDisks();
                requestResync();
                requestHostname();
            }
        });
        next = nextRound(next, _options.checkInterval);
    } while (_shutdown.sleepUntil(next, {&_health.peerAppeared()}));
}

void PeerWatcher::requestDisks() {
    const Json::Value unread("unread");
    Json::Value disks = unread;
    bool isHandling = false;
    const bool hasReply = exchange([&] { isHandling = Observed<IsRemoteDiskErrHandling>()(disks); });
    if (_shutdown.isRequested() || !hasReply) {
        return;
    }
    const bool isRead = disks != unread;
    // A report that cannot be read was cut, because it has more disks than a datagram holds: there are
    // errors, on disks that are not known. Those of the report before may have recovered.
    _health.status().setErrHandlingDiskRemote(isRead ? disks : Json::Value(Json::arrayValue));
    _health.findings().setPeerDisksKnown(isRead);
    _health.set(Flag::peerDiskErrors, isHandling || !isRead);
}

void PeerWatcher::requestResync() {
    bool isResync = false;
    const bool hasReply = exchange([&] { isResync = Observed<IsRemoteMDResync>()(); });
    if (_shutdown.isRequested() || !hasReply) {
        return;
    }
    // A reply that says nothing and "no resync" look alike: the end is believed when it is reported twice.
    _health.set(Flag::peerResync, isResync || _wasResync);
    _wasResync = isResync;
}

void PeerWatcher::requestHostname() {
    if (_isHostnameKnown || _shutdown.isRequested()) {
        return;
    }
    std::string hostname;
    _isHostnameKnown = TERN::HA::Daemon::GetRemoteHostname()(hostname);
    if (_isHostnameKnown) {
        _health.findings().setPeerName(printable(hostname));
        TERNHAD_LOG(_events, "Remote hostname is " + printable(hostname));
    }
}

}  // namespace ternhad
