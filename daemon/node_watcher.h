#pragma once

#include "checker.h"
#include "event.h"
#include "health.h"
#include "options.h"
#include "progress.h"

namespace ternhad {

// Watches this node: DRBD, md arrays, disks and the replication link. For two threads, since a measurement of
// the link takes up to 10 seconds.
class NodeWatcher {
 public:
    NodeWatcher(const Options& options, Health& health, const Shutdown& shutdown, Progress& progress)
        : _options(options), _health(health), _shutdown(shutdown), _progress(progress) {}

    // The bodies of the threads.
    void runChecks();
    void runMeasurements();

 private:
    void check();
    void measure(TERN::HA::Daemon::InterfaceChecker& interface);

    const Options& _options;
    Health& _health;
    const Shutdown& _shutdown;
    Progress& _progress;
};

}  // namespace ternhad
