#pragma once

#include "checker.h"
#include "event.h"
#include "events.h"

namespace ternhad {

// Carries out the peer's order to reboot this node: moves the logs, flushes the file systems and has the
// kernel restart. The last is done after 5 seconds even when the first two hang: the peer takes over then.
class Reboot {
 public:
    Reboot(Events& events, const Shutdown& shutdown) : _events(events), _shutdown(shutdown) {}

    // Body of the thread that moves and flushes.
    void flush();

    // The rest is for the thread that serves the peer, and waits for nothing.

    void order() noexcept;
    bool isOrdered() const noexcept { return _isOrdered; }

    // While a reboot is ordered: call complete() at this time, or when the event is set.
    Clock::time_point deadline() const noexcept { return _deadline; }
    const Event& flushed() const noexcept { return _flushed; }

    // Has the kernel restart when it is time. False when it is and the kernel cannot be told; the order is
    // given up then.
    bool complete() noexcept;

 private:
    Events& _events;
    const Shutdown& _shutdown;
    Event _ordered;
    Event _flushed;
    bool _isOrdered = false;
    Clock::time_point _deadline;
};

// The peer checks whose library versions would read or write files in the thread that serves the peer.

// Hands the order to a Reboot.
class RebootCheck : public TERN::HA::Daemon::RebootRemote {
 public:
    std::string handle(TERN::HA::Daemon::Status& status) override;
};

// Replies with the name that is known.
class HostnameCheck : public TERN::HA::Daemon::GetRemoteHostname {
 public:
    std::string handle(TERN::HA::Daemon::Status& status) override;
};

class Health;

// Puts these checks into the registry in place of the library's. Call before there are threads; both objects
// must outlive the peer server.
void replacePeerChecks(Reboot& reboot, const Health& health);

}  // namespace ternhad
