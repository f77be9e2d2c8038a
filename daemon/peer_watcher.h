#pragma once

#include "event.h"
#include "events.h"
#include "health.h"
#include "options.h"

namespace ternhad {

// Requests disks, resync and, once, the hostname of a peer that is alive. For one thread.
class PeerWatcher {
 public:
    PeerWatcher(const Options& options, Health& health, Events& events, const Shutdown& shutdown)
        : _options(options), _health(health), _events(events), _shutdown(shutdown) {}

    // Thread body.
    void run();

 private:
    void requestDisks();
    bool isReportCut() const;
    void requestResync();
    void requestHostname();

    const Options& _options;
    Health& _health;
    Events& _events;
    const Shutdown& _shutdown;
    bool _isHostnameKnown = false;
};

}  // namespace ternhad
