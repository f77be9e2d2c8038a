#pragma once

#include "checker.h"
#include "event.h"
#include "events.h"

namespace ternhad {

// Reboots this node at the peer's request: moves the logs, flushes the file systems and writes the
// reboot trigger; the last step follows after 5 seconds even if the others hang, because the peer
// takes over then.
class Reboot {
 public:
    Reboot(Events& events, const Shutdown& shutdown) : _events(events), _shutdown(shutdown) {}

    // Body of the thread that moves the logs and flushes.
    void flush();

    // The following functions are for the thread that serves the peer; they do not block.

    void order() noexcept;
    bool isOrdered() const noexcept { return _isOrdered; }

    // While a reboot is requested: call complete() at this time, or when the event is set.
    Clock::time_point deadline() const noexcept { return _deadline; }
    const Event& flushed() const noexcept { return _flushed; }

    // Write the trigger if it is time. Returns false if that fails; the request is then dropped.
    bool complete() noexcept;

 private:
    Events& _events;
    const Shutdown& _shutdown;
    Event _ordered;
    Event _flushed;
    bool _isOrdered = false;
    Clock::time_point _deadline;
};

// Replacements for the two peer checks whose library versions access files in the thread that
// serves the peer.

// Passes the request to a Reboot.
class RebootCheck : public TERN::HA::Daemon::RebootRemote {
 public:
    std::string handle(TERN::HA::Daemon::Status& status) override;
};

// Replies with the name that the checks thread has read.
class HostnameCheck : public TERN::HA::Daemon::GetRemoteHostname {
 public:
    std::string handle(TERN::HA::Daemon::Status& status) override;
};

class Health;

// Replace the library's checks in the registry by these. To be called before threads are started;
// both objects must outlive the peer server.
void replacePeerChecks(Reboot& reboot, const Health& health);

}  // namespace ternhad
