#include "status.h"

#include <chrono>
#include <utility>

#include "ha_log.h"
#include "json_text.h"

namespace TERN::HA::Daemon {

namespace {

using Lock = std::unique_lock<std::timed_mutex>;

// The lock may not be owned; callers proceed anyway. Waits on the monotonic clock: a step of the
// wall clock must not change the duration.
// Frozen: docs/compatibility.md#status-without-lock
Lock lockFor(std::timed_mutex& mutex, std::int32_t timeout) {
    return {mutex, std::chrono::steady_clock::now() + std::chrono::seconds(timeout)};
}

Json::Value toArray(const std::set<std::string>& names) {
    Json::Value array(Json::arrayValue);
    for (const std::string& name : names) {
        array.append(name);
    }
    return array;
}

std::set<std::string> toSet(const Json::Value& array) {
    std::set<std::string> names;
    for (const Json::Value& element : array) {
        if (const std::optional<std::string> name = readString(element)) {
            names.insert(*name);
        }
    }
    return names;
}

}  // namespace

Status::Status()
    : isRemoteMDResync(false),
      isRemoteDiskErrHandling(false),
      isMDResync(false),
      isDiskErrHandling(false),
      // Frozen: docs/compatibility.md#drbd-starts-connected
      isDRBDConnect(true),
      heartbeatPacketFailRate(0),
      heartbeatLatency(0),
      remoteNodeState(0),
      lockTimeout(5) {}

bool Status::addRemoteNodeState(NodeState state) {
    const Lock lock = lockFor(remoteNodeStateMutex, lockTimeout);
    remoteNodeState |= state;
    return true;
}

bool Status::delRemoteNodeState(NodeState state) {
    const Lock lock = lockFor(remoteNodeStateMutex, lockTimeout);
    remoteNodeState &= ~static_cast<std::uint32_t>(state);
    return true;
}

bool Status::isRemoteNodeState(NodeState state) const {
    return (remoteNodeState & state) != 0;
}

bool Status::isRemoteAlive() const {
    return isRemoteNodeState(NodeAlive);
}

bool Status::isRemoteRebooting() const {
    return isRemoteNodeState(NodeRebooting) || isRemoteNodeState(NodeRebootPending);
}

NodeState Status::getRemoteNodeState() const {
    return static_cast<NodeState>(remoteNodeState.load());
}

bool Status::setRemoteAlive(bool alive) {
    // Frozen: docs/compatibility.md#logged-before-set
    if (isRemoteNodeState(NodeAlive) != alive) {
        HA_LOG(std::string("Remote server status changed to ") + (alive ? "alive" : "dead"));
    }
    if (alive) {
        addRemoteNodeState(NodeAlive);
        // Frozen: docs/compatibility.md#pending-reboot-survives
        if (isRemoteNodeState(NodeRebooting)) {
            delRemoteNodeState(NodeRebooting);
        }
    } else {
        delRemoteNodeState(NodeAlive);
    }
    return true;
}

Json::Value Status::getErrHandlingDisk() {
    const Lock lock = lockFor(errHandlingDiskMutex, lockTimeout);
    return toArray(errHandlingDisk);
}

Json::Value Status::getErrHandlingDiskRemote() {
    const Lock lock = lockFor(errHandlingDiskRemoteMutex, lockTimeout);
    return toArray(errHandlingDiskRemote);
}

bool Status::setErrHandlingDisk(const Json::Value& disks) {
    std::set<std::string> names = toSet(disks);
    const Lock lock = lockFor(errHandlingDiskMutex, lockTimeout);
    errHandlingDisk.swap(names);
    return true;
}

bool Status::setErrHandlingDiskRemote(const Json::Value& disks) {
    std::set<std::string> names = toSet(disks);
    const Lock lock = lockFor(errHandlingDiskRemoteMutex, lockTimeout);
    errHandlingDiskRemote.swap(names);
    return true;
}

Json::Value Status::toJson() {
    Json::Value json(Json::objectValue);
    // The keys are literals, which need no copy.
    const auto set = [&json](const char* key, Json::Value value) {
        json[Json::StaticString(key)] = std::move(value);
    };
    set("isRemoteAlive", isRemoteAlive());
    set("isRemoteMDResync", isRemoteMDResync.load());
    set("isRemoteDiskErrHandling", isRemoteDiskErrHandling.load());
    set("isMDResync", isMDResync.load());
    set("isDiskErrHandling", isDiskErrHandling.load());
    set("isDRBDConnect", isDRBDConnect.load());
    set("heartbeatPacketFailRate", static_cast<double>(heartbeatPacketFailRate.load()));
    set("heartbeatLatency", static_cast<double>(heartbeatLatency.load()));
    set("diskErrorHandlingDisk", getErrHandlingDisk());
    set("diskErrorHandlingDiskRemote", getErrHandlingDiskRemote());
    return json;
}

}  // namespace TERN::HA::Daemon
