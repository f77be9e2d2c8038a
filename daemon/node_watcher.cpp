#include "node_watcher.h"

#include <glob.h>
#include <json/value.h>
#include <net/if.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <fstream>
#include <string>

#include "passes.h"
#include "printable.h"

namespace ternhad {

namespace {

// Return the version in /proc/drbd unless it is 8; others do not list their connections there.
std::string unsupportedDrbd() {
    std::ifstream file("/proc/drbd");
    std::string word;
    std::string version;
    file >> word >> version;
    return word == "version:" && version.rfind("8.", 0) != 0 ? printable(version) : std::string();
}

}  // namespace

void NodeWatcher::runChecks() {
    Passes passes;
    auto next = Clock::now();
    do {
        passes.run([this] { check(); });
        next = nextRound(next, _options.checkInterval);
    } while (_shutdown.sleepUntil(next));
}

// Log once when the files are missing, and once when they appear.
bool NodeWatcher::isThere(KernelFiles& files) {
    glob_t found = {};
    const bool areThere = glob(files.pattern, GLOB_NOSORT, nullptr, &found) == 0;
    globfree(&found);
    if (files.wereThere != areThere) {
        if (!areThere) {
            TERNHAD_LOG(_events, std::string("No ") + files.what + ": no " + files.pattern);
        } else if (files.wereThere) {
            TERNHAD_LOG(_events, std::string("Found ") + files.what + ": " + files.pattern);
        }
        files.wereThere = areThere;
    }
    return areThere;
}

// Skip a check whose files are missing: same result, but no log line in each round.
void NodeWatcher::check() {
    checkDrbd();
    _health.set(Flag::resync, isThere(_arrays) && TERN::HA::Daemon::isMDResync());
    checkDisks();
    _health.updatePeerRebooting();
    _health.setHostname(TERN::HA::Daemon::getLocalHostname());
    _progress.made(Progress::nodeWatcher);
}

void NodeWatcher::checkDrbd() {
    const bool isDrbdThere = isThere(_drbd);
    const bool isConnected = isDrbdThere && TERN::HA::Daemon::isDRBDConnect();
    const std::string unsupported = isDrbdThere ? unsupportedDrbd() : "";
    if (unsupported != _health.findings().unsupportedDrbd()) {
        _health.findings().setUnsupportedDrbd(unsupported);
        if (!unsupported.empty()) {
            TERNHAD_LOG(_events, "DRBD " + unsupported + " is not supported, 8.4 is");
        }
    }
    if (unsupported.empty()) {
        _health.set(Flag::drbdConnected, isConnected);
    } else {
        _health.status().isDRBDConnect = isConnected;  // in the record only; the flag stays unknown
    }
}

void NodeWatcher::checkDisks() {
    Json::Value disks(Json::arrayValue);
    const bool isHandling = isThere(_ports) && TERN::HA::Daemon::isDiskErrHandling(disks);
    _health.status().setErrHandlingDisk(disks);
    _health.set(Flag::diskErrors, isHandling);
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

// ifconfig -s lists only interfaces that are up.
bool NodeWatcher::isInterfaceUp() {
    const int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    ifreq request = {};
    _options.interface.copy(static_cast<char*>(request.ifr_name), IFNAMSIZ - 1);
    const bool isUp = ioctl(fd, SIOCGIFFLAGS, &request) == 0 && (request.ifr_flags & IFF_UP) != 0;
    close(fd);
    return isUp;
}

void NodeWatcher::measure(TERN::HA::Daemon::InterfaceChecker& interface) {
    float rate = 0;
    // Outside of 0 to 1, the counters were reset or the interface went down.
    const bool isMeasured = isInterfaceUp() && interface.networkNonOkRate(rate) && rate >= 0 && rate <= 1;
    _health.findings().setNonOkRate(isMeasured ? std::optional<double>(rate) : std::nullopt);
    _health.status().heartbeatPacketFailRate = isMeasured ? rate : 0;

    // Do not ping a dead peer: it takes 10 seconds and yields nothing.
    const float latency = _health.isPeerAlive() ? TERN::HA::Daemon::heartbeatLatency() : 0;
    if (!_shutdown.isRequested()) {
        _health.status().heartbeatLatency = latency;
        if (latency > 0) {
            _health.findings().setLatency(latency);
        } else {
            _health.findings().setLatencyStale();
        }
    }
}

}  // namespace ternhad
