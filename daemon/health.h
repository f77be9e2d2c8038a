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

// The node's health record, and the one place through which its flags change: the record first, then the
// trace. Thread-safe.
class Health {
 public:
    // `staleAfter`: see Transitions.
    Health(Events& events, Clock::duration staleAfter) : _events(events), _transitions(staleAfter) {}

    TERN::HA::Daemon::Status& status() noexcept { return _status; }

    bool isPeerAlive() const noexcept { return _status.isRemoteAlive(); }

    // Nothing until the peer has replied, or could have for long enough.
    bool isPeerKnown() const noexcept { return _transitions.state(Flag::peerAlive).value.has_value(); }

    // The outcome of the liveness probes, as Status::setRemoteAlive stores it; do not call before there is
    // one. Waits for nothing but the record's lock, under which nobody waits.
    void setPeerAlive(bool isAlive) noexcept;

    // The peer has replied to a liveness probe: it is no longer being rebooted.
    void peerReplied() noexcept;

    // Any other flag.
    void set(Flag flag, bool value) noexcept;

    // Stores whether the peer is being rebooted as the record has it now.
    void updatePeerRebooting() noexcept {
        _transitions.found(Flag::peerRebooting, _status.isRemoteRebooting());
    }

    Transitions& transitions() noexcept { return _transitions; }
    const Transitions& transitions() const noexcept { return _transitions; }
    Findings& findings() noexcept { return _findings; }
    const Findings& findings() const noexcept { return _findings; }

    // This node's own host name; empty while unknown.
    std::string hostname() const;
    void setHostname(const std::string& name);

    // Set when the peer has become alive, and when something has changed that is worth a snapshot.
    Event& peerAppeared() noexcept { return _peerAppeared; }
    Event& snapshotWanted() noexcept { return _snapshotWanted; }

 private:
    std::atomic<bool>& flagOf(Flag flag) noexcept;

    Events& _events;
    TERN::HA::Daemon::Status _status;
    Transitions _transitions;
    Findings _findings;
    mutable std::mutex _mutex;  // guards the name
    std::string _hostname;
    Event _peerAppeared;
    Event _snapshotWanted;
};

}  // namespace ternhad
