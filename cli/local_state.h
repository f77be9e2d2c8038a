#pragma once

#include <string>
#include <vector>

namespace ternhactl {

// State of this node's kernel that the daemon's record has no field for.
struct LocalState {
    bool hasDrbd = false;                          // /proc/drbd exists
    bool hasResources = false;                     // DRBD has a configured resource
    std::string unsupportedDrbd;                   // the version of DRBD when it is not 8
    std::vector<std::string> replicaProblems;      // such as "DRBD 0 replica Inconsistent"
    std::vector<std::string> peerReplicaProblems;  // the same of the connected peer
    std::vector<std::string> unlinked;             // its resources that are not connected
    bool hasArrays = false;                        // md
    std::vector<std::string> arrayProblems;        // such as "md0 degraded"
    bool hasAtaPorts = false;
    bool isErrorHandlingKnown = false;  // only some kernels have the attribute

    // What DRBD lacks to connect at all, such as "no /proc/drbd"; empty if nothing.
    std::string missingDrbd() const;
};

// Read /proc/drbd and sysfs, as any user may. Unreadable files count as missing.
LocalState readLocalState();

}  // namespace ternhactl
