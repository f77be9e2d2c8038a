#include "node_watcher.h"

#include <json/value.h>

#include "passes.h"

namespace ternhad {

void NodeWatcher::runChecks() {
    Passes passes;
    auto next = Clock::now();
    do {
        passes.run([this] { check(); });
        next = nextRound(next, _options.checkInterval);
    } while (_shutdown.sleepUntil(next));
}

void NodeWatcher::check() {
    _health.set(Flag::drbdConnected, TERN::HA::Daemon::isDRBDConnect());
    _health.set(Flag::resync, TERN::HA::Daemon::isMDResync());

    Json::Value disks(Json::arrayValue);
    const bool isHandling = TERN::HA::Daemon::isDiskErrHandling(disks);
    _health.status().setErrHandlingDisk(disks);
    _health.set(Flag::diskErrors, isHandling);

    _health.setHostname(TERN::HA::Daemon::getLocalHostname());
    _progress.made(Progress::nodeWatcher);
}

void NodeWatcher::runMeasurements() {
    TERN::HA::Daemon::InterfaceChecker interface;
    Passes passes;
    auto next = Clock::now();
    do {
        passes.run([this, &interface] { measure(interface); });
        next = nextRound(next, _options.heartbeatInterval);
    } while (_shutdown.sleepUntil(next));
}

void NodeWatcher::measure(TERN::HA::Daemon::InterfaceChecker& interface) {
    float rate = 0;
    if (interface.networkNonOkRate(rate)) {
        _health.status().heartbeatPacketFailRate = rate;
    }
    // A ping without a reply takes 10 seconds and shows nothing new.
    const float latency = _health.isPeerAlive() ? TERN::HA::Daemon::heartbeatLatency() : 0;
    if (!_shutdown.isRequested()) {
        _health.status().heartbeatLatency = latency;
    }
}

}  // namespace ternhad
