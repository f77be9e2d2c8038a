#include "peer_watcher.h"

#include <json/value.h>

#include <string>

#include "checker.h"
#include "passes.h"
#include "printable.h"

namespace ternhad {

namespace {

// A request that took as long as this got no reply, whatever its result. The library waits for 3 seconds.
constexpr auto REPLY_LIMIT = std::chrono::milliseconds(2900);

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
    const auto start = Clock::now();
    const bool isHandling = TERN::HA::Daemon::IsRemoteDiskErrHandling()(disks);
    if (_shutdown.isRequested() || Clock::now() - start >= REPLY_LIMIT) {
        return;
    }
    const bool isRead = disks != unread;
    if (isRead) {
        _health.status().setErrHandlingDiskRemote(disks);
    }
    // A report that cannot be read was cut, because it has more disks than a datagram holds.
    _health.set(Flag::peerDiskErrors, isHandling || !isRead);
}

void PeerWatcher::requestResync() {
    const auto start = Clock::now();
    const bool isResync = TERN::HA::Daemon::IsRemoteMDResync()();
    if (_shutdown.isRequested() || Clock::now() - start >= REPLY_LIMIT) {
        return;
    }
    // A request that could not be sent and "no resync" look alike: the end is believed when it is reported
    // twice.
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
        TERNHAD_LOG(_events, "Remote hostname is " + printable(hostname));
    }
}

}  // namespace ternhad
