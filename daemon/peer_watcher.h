#pragma once

#include "event.h"
#include "events.h"
#include "health.h"
#include "options.h"

namespace ternhad {

// Asks a peer that is alive for its disks, its resync and, once, its host name. For one thread.
class PeerWatcher {
 public:
    PeerWatcher(const Options& options, Health& health, Events& events, const Shutdown& shutdown)
        : _options(options), _health(health), _events(events), _shutdown(shutdown) {}

    // Body of the thread.
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
