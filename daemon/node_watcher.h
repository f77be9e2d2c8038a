#pragma once

#include <optional>

#include "checker.h"
#include "event.h"
#include "health.h"
#include "options.h"
#include "progress.h"

namespace ternhad {

// Monitors this node: DRBD, md arrays, disks and the replication link. For two threads, because
// measuring the link takes up to 10 seconds.
class NodeWatcher {
 public:
    NodeWatcher(const Options& options, Health& health, Events& events, const Shutdown& shutdown,
                Progress& progress)
        : _options(options), _health(health), _events(events), _shutdown(shutdown), _progress(progress) {}

    // Thread bodies.
    void runChecks();
    void runMeasurements();

 private:
    // Kernel files of a feature that this node may lack.
    struct KernelFiles {
        const char* pattern;
        const char* what;
        std::optional<bool> wereThere;
    };

    void check();
    void checkDrbd();
    void checkDisks();
    bool isThere(KernelFiles& files);
    bool isInterfaceUp();
    void measure(TERN::HA::Daemon::InterfaceChecker& interface);

    const Options& _options;
    Health& _health;
    Events& _events;
    const Shutdown& _shutdown;
    Progress& _progress;

    KernelFiles _drbd{"/proc/drbd", "DRBD", {}};
    KernelFiles _arrays{"/sys/block/md*/md/sync_action", "md arrays with redundancy", {}};
    KernelFiles _ports{
        "/sys/class/ata_port/ata*/error_handling", "ATA ports that tell of error handling", {}};
};

}  // namespace ternhad
