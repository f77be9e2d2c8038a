/// @file
/// Health record of a node.

#pragma once

#include <json/value.h>

#include <atomic>
#include <cstdint>
#include <mutex>
#include <set>
#include <string>

#pragma GCC visibility push(default)

/// The daemon library. The classes of the peer protocol (chkstate.h, env_check.h) stand at global
/// scope.
namespace TERN::HA::Daemon {

/// Life cycle of the peer. Each value is a single bit; several may be set at once.
enum NodeState : std::uint32_t {
    NodeAlive = 1,          ///< alive: set and cleared by Status::setRemoteAlive
    NodeRebootPending = 2,  ///< reboot requested, not yet declared dead
    NodeRebooting = 4,      ///< rebooting, until it is alive again
};

/// Return the union of both bit sets.
constexpr NodeState operator|(NodeState a, NodeState b) {
    return static_cast<NodeState>(static_cast<std::uint32_t>(a) | static_cast<std::uint32_t>(b));
}

/// Health record of a node: its own state, the state that its peer reported, and the life cycle of
/// the peer. One object per process, shared by all threads of the daemon; nothing in it outlives
/// the process.
///
/// Thread-safe. The const operations neither lock nor block. The others lock one mutex at a time,
/// for which they wait up to 5 seconds, and then proceed without the lock: a hung holder delays an
/// update but never blocks it. No operation fails unless memory runs out: those that take or return
/// JSON then throw and leave the record unchanged, and setRemoteAlive drops its log line.
class Status {
 public:
    /// Construct a record in which isDRBDConnect is true, every other flag false, every number 0,
    /// and both lists and the node state are empty.
    Status();

    Status(const Status&) = delete;
    Status& operator=(const Status&) = delete;

    // Read and written directly by the daemon and the checks. Each access is atomic and
    // sequentially consistent; nothing ties two fields together, so a reader may see one updated
    // and the next not yet.
    std::atomic<bool> isRemoteMDResync;          ///< the peer reported an md resync
    std::atomic<bool> isRemoteDiskErrHandling;   ///< the peer reported disk error handling
    std::atomic<bool> isMDResync;                ///< this node has an md resync in progress
    std::atomic<bool> isDiskErrHandling;         ///< this node has disk error handling in progress
    std::atomic<bool> isDRBDConnect;             ///< the DRBD link is connected; true until first checked
    std::atomic<float> heartbeatPacketFailRate;  ///< packet failure rate, as defined by the host daemon
    std::atomic<float> heartbeatLatency;         ///< average round trip to the peer, milliseconds; 0: unknown

    /// Set the bits of `state`, leave the others unchanged. Returns true.
    bool addRemoteNodeState(NodeState state);

    /// Clear the bits of `state`, leave the others unchanged. Returns true.
    bool delRemoteNodeState(NodeState state);

    /// Return true when any bit of `state` is set.
    bool isRemoteNodeState(NodeState state) const;

    /// Return true when the peer is alive (NodeAlive).
    bool isRemoteAlive() const;

    /// Return true when the peer is being rebooted: NodeRebooting or NodeRebootPending is set.
    bool isRemoteRebooting() const;

    /// Return all bits.
    NodeState getRemoteNodeState() const;

    /// Record whether the peer is alive: set or clear NodeAlive. Returns true.
    ///
    /// A change is logged first: "Remote server status changed to " and "alive" or "dead". A peer
    /// that is alive is no longer NodeRebooting, but stays NodeRebootPending; one that is dead
    /// keeps both bits. Blocks for the log as DaemonLog::set does, and for up to two locks.
    bool setRemoteAlive(bool alive);

    /// Return the device names of this node's disks under error handling: a JSON array of strings
    /// in ascending order, empty when there are none.
    Json::Value getErrHandlingDisk();

    /// Return the device names of the peer's disks under error handling, in the same form.
    Json::Value getErrHandlingDiskRemote();

    /// Replace the device names of this node's disks under error handling by the elements of
    /// `disks`, an array of strings. Duplicates collapse; an element that cannot be read as a
    /// string is skipped; null or an empty array clears the list. Returns true.
    bool setErrHandlingDisk(const Json::Value& disks);

    /// Replace the device names of the peer's disks under error handling in the same way. Returns
    /// true.
    bool setErrHandlingDiskRemote(const Json::Value& disks);

    /// Return the record as a JSON object with ten members: "isRemoteAlive", "isRemoteMDResync",
    /// "isRemoteDiskErrHandling", "isMDResync", "isDiskErrHandling", "isDRBDConnect" (booleans),
    /// "heartbeatPacketFailRate", "heartbeatLatency" (reals), "diskErrorHandlingDisk",
    /// "diskErrorHandlingDiskRemote" (arrays of strings). Blocks for the locks of the two lists,
    /// one after the other.
    Json::Value toJson();

 private:
    std::set<std::string> errHandlingDisk;
    std::timed_mutex errHandlingDiskMutex;
    std::set<std::string> errHandlingDiskRemote;
    std::timed_mutex errHandlingDiskRemoteMutex;
    std::atomic<std::uint32_t> remoteNodeState;  ///< atomic, because it is read without the mutex
    std::timed_mutex remoteNodeStateMutex;
    std::int32_t lockTimeout;  ///< seconds
};

}  // namespace TERN::HA::Daemon

#pragma GCC visibility pop
