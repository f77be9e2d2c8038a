#pragma once

#include <atomic>
#include <mutex>
#include <string>

#include "event.h"
#include "events.h"
#include "status.h"

namespace ternhad {

// The node's health record, and the one place through which its flags change: the record first, then the
// trace. Thread-safe.
class Health {
 public:
    explicit Health(Events& events) : _events(events) {}

    TERN::HA::Daemon::Status& status() noexcept { return _status; }

    bool isPeerAlive() const noexcept { return _status.isRemoteAlive(); }

    // The outcome of the liveness probes, as Status::setRemoteAlive stores it. Waits for nothing but the
    // record's lock, under which nobody waits.
    void setPeerAlive(bool isAlive) noexcept;

    // Any other flag.
    void set(Flag flag, bool value) noexcept;

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
    mutable std::mutex _mutex;  // guards the name
    std::string _hostname;
    Event _peerAppeared;
    Event _snapshotWanted;
};

}  // namespace ternhad
