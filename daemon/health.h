#pragma once

#include <atomic>
#include <mutex>
#include <string>

#include "event.h"
#include "events.h"
#include "findings.h"
#include "status.h"
#include "transitions.h"

namespace ternhad {

// The status record of this node, and the only place that changes its flags: stores the change
// first, then records the event. Thread-safe.
class Health {
 public:
    // `staleAfter`: see Transitions.
    Health(Events& events, Clock::duration staleAfter) : _events(events), _transitions(staleAfter) {}

    TERN::HA::Daemon::Status& status() noexcept { return _status; }

    bool isPeerAlive() const noexcept { return _status.isRemoteAlive(); }

    // Nothing until the peer has replied, or has not for `dead-after`.
    bool isPeerKnown() const noexcept { return _transitions.state(Flag::peerAlive).value.has_value(); }

    // Store the outcome of the liveness probes as Status::setRemoteAlive does; not to be called
    // while it is unknown. Blocks only for the lock of the record, which is never held while
    // blocking.
    void setPeerAlive(bool isAlive) noexcept;

    // Record a reply to a liveness probe: the peer is no longer being rebooted.
    void peerReplied() noexcept;

    // Store any other flag.
    void set(Flag flag, bool value) noexcept;

    // Copy the reboot state of the record to the transitions.
    void updatePeerRebooting() noexcept {
        _transitions.found(Flag::peerRebooting, _status.isRemoteRebooting());
    }

    Transitions& transitions() noexcept { return _transitions; }
    const Transitions& transitions() const noexcept { return _transitions; }
    Findings& findings() noexcept { return _findings; }
    const Findings& findings() const noexcept { return _findings; }

    // This node's own hostname; empty while unknown.
    std::string hostname() const;
    void setHostname(const std::string& name);

    // Set when the peer has become alive, and when a transition calls for a snapshot.
    Event& peerAppeared() noexcept { return _peerAppeared; }
    Event& snapshotWanted() noexcept { return _snapshotWanted; }

 private:
    std::atomic<bool>& flagOf(Flag flag) noexcept;

    Events& _events;
    TERN::HA::Daemon::Status _status;
    Transitions _transitions;
    Findings _findings;
    mutable std::mutex _mutex;  // guards the hostname
    std::string _hostname;
    Event _peerAppeared;
    Event _snapshotWanted;
};

}  // namespace ternhad
