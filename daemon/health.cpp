#include "health.h"

namespace ternhad {

using TERN::HA::Daemon::NodeAlive;
using TERN::HA::Daemon::NodeRebooting;

void Health::setPeerAlive(bool isAlive) noexcept {
    if (isAlive == isPeerAlive()) {
        _transitions.found(Flag::peerAlive, isAlive);
        return;
    }
    if (isAlive) {
        _status.addRemoteNodeState(NodeAlive);
        _peerAppeared.set();
    } else {
        _status.delRemoteNodeState(NodeAlive);
        _snapshotWanted.set();
    }
    _transitions.found(Flag::peerAlive, isAlive);
    _events.changed(Flag::peerAlive, isAlive);
}

// Cleared by a reply, not by the alive bit: that stays set for `dead-after` after the peer went
// down.
void Health::peerReplied() noexcept {
    _findings.peerReplied();
    if ((_status.getRemoteNodeState() & NodeRebooting) != 0) {
        _status.delRemoteNodeState(NodeRebooting);
    }
}

void Health::set(Flag flag, bool value) noexcept {
    const bool isSame = flagOf(flag).exchange(value) == value;
    _transitions.found(flag, value);
    if (isSame) {
        return;
    }
    if (value && flag != Flag::drbdConnected) {
        _snapshotWanted.set();  // a failover is unsafe from now on
    }
    _events.changed(flag, value);
}

std::atomic<bool>& Health::flagOf(Flag flag) noexcept {
    switch (flag) {
        case Flag::peerResync:
            return _status.isRemoteMDResync;
        case Flag::peerDiskErrors:
            return _status.isRemoteDiskErrHandling;
        case Flag::resync:
            return _status.isMDResync;
        case Flag::diskErrors:
            return _status.isDiskErrHandling;
        case Flag::drbdConnected:
        case Flag::peerAlive:
        case Flag::peerRebooting:
            break;
    }
    return _status.isDRBDConnect;
}

std::string Health::hostname() const {
    const std::lock_guard<std::mutex> lock(_mutex);
    return _hostname;
}

void Health::setHostname(const std::string& name) {
    const std::lock_guard<std::mutex> lock(_mutex);
    _hostname = name;
}

}  // namespace ternhad
