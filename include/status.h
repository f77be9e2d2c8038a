/// @file
/// The health record of a node.

#pragma once

#include <json/value.h>

#include <atomic>
#include <cstdint>
#include <mutex>
#include <set>
#include <string>

#pragma GCC visibility push(default)

/// The library, apart from what the peer protocol needs, which stands at global scope.
namespace TERN::HA::Daemon {

/// What is known of the peer's life cycle. Single bits: several may be set at once.
enum NodeState : std::uint32_t {
    NodeAlive = 1,          ///< it answered the last liveness check
    NodeRebootPending = 2,  ///< it was asked to reboot and has not been seen to go down
    NodeRebooting = 4,      ///< it is taken to be rebooting, until it answers again
};

/// Both sets of bits.
constexpr NodeState operator|(NodeState a, NodeState b) {
    return static_cast<NodeState>(static_cast<std::uint32_t>(a) | static_cast<std::uint32_t>(b));
}

/// The one health record of a node, shared by all threads of its daemon: the node's own findings, what it
/// learned of its peer, and the peer's life cycle. Nothing in it outlives the process.
///
/// Thread-safe. No operation reports a failure. The operations that are not const lock one mutex each, never
/// two; they wait up to 5 seconds for it and then go ahead without it: a stuck holder delays an update but
/// never stops it. The const operations do not lock and do not block.
class Status {
 public:
    /// A record of nothing known: all false, 0 and empty, but for isDRBDConnect.
    Status();

    Status(const Status&) = delete;
    Status& operator=(const Status&) = delete;

    // Read and written directly by the daemon and the checks. Each is indivisible by itself; nothing ties
    // two of them together.
    std::atomic<bool> isRemoteMDResync;          ///< the peer reported an md resync
    std::atomic<bool> isRemoteDiskErrHandling;   ///< the peer reported disk error handling
    std::atomic<bool> isMDResync;                ///< this node has an md resync
    std::atomic<bool> isDiskErrHandling;         ///< this node has disk error handling
    std::atomic<bool> isDRBDConnect;             ///< the DRBD link is up; true until the first check has run
    std::atomic<float> heartbeatPacketFailRate;  ///< the host decides which packets
    std::atomic<float> heartbeatLatency;         ///< milliseconds

    /// Sets the bits of `state`; bits that are set stay so. Always true.
    bool addRemoteNodeState(NodeState state);

    /// Clears the bits of `state`; bits that are clear stay so. Always true.
    bool delRemoteNodeState(NodeState state);

    /// True when any bit of `state` is set.
    bool isRemoteNodeState(NodeState state) const;

    /// True when the peer answered the last liveness check.
    bool isRemoteAlive() const;

    /// True from the request for a reboot until the peer answers again.
    bool isRemoteRebooting() const;

    /// All bits.
    NodeState getRemoteNodeState() const;

    /// Records the outcome of a liveness check. A change is logged: "Remote server status changed to " and
    /// "alive" or "dead". A peer that is alive is no longer rebooting (a pending reboot stays pending); one
    /// that is dead keeps its reboot bits. Always true.
    bool setRemoteAlive(bool alive);

    /// The names of this node's disks under error handling: a JSON array of strings in ascending order, an
    /// empty array when there are none.
    Json::Value getErrHandlingDisk();

    /// The same of the peer's disks.
    Json::Value getErrHandlingDiskRemote();

    /// Replaces the names of this node's disks by the elements of `disks` (array of strings). Duplicates
    /// collapse; an element that cannot be read as a string is passed over; a null or empty value leaves no
    /// name. Always true.
    bool setErrHandlingDisk(const Json::Value& disks);

    /// The same for the peer's disks.
    bool setErrHandlingDiskRemote(const Json::Value& disks);

    /// The record as a JSON object: "isRemoteAlive", "isRemoteMDResync", "isRemoteDiskErrHandling",
    /// "isMDResync", "isDiskErrHandling", "isDRBDConnect" (booleans), "heartbeatPacketFailRate",
    /// "heartbeatLatency" (reals), "diskErrorHandlingDisk", "diskErrorHandlingDiskRemote" (arrays of
    /// strings). Waits for the two lists' mutexes one after the other.
    Json::Value toJson();

 private:
    std::set<std::string> errHandlingDisk;
    std::timed_mutex errHandlingDiskMutex;
    std::set<std::string> errHandlingDiskRemote;
    std::timed_mutex errHandlingDiskRemoteMutex;
    std::atomic<std::uint32_t> remoteNodeState;  ///< an atomic word: it is read without the mutex
    std::timed_mutex remoteNodeStateMutex;
    std::int32_t lockTimeout;  ///< seconds
};

}  // namespace TERN::HA::Daemon

#pragma GCC visibility pop
