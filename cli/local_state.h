#pragma once

#include <string>
#include <vector>

namespace ternhactl {

// What the kernel tells of this node and the daemon's record has no place for.
struct LocalState {
    bool hasDrbd = false;                          // there is a /proc/drbd
    bool hasResources = false;                     // DRBD has one that is configured
    std::string unsupportedDrbd;                   // the version of DRBD when it is not 8
    std::vector<std::string> replicaProblems;      // as "DRBD 0 replica Inconsistent"
    std::vector<std::string> peerReplicaProblems;  // the same of the connected peer
    std::vector<std::string> unlinked;             // its resources that are not connected
    bool hasArrays = false;                        // md
    std::vector<std::string> arrayProblems;        // as "md0 degraded"
    bool hasAtaPorts = false;
    bool isErrorHandlingKnown = false;  // not every kernel's ATA ports tell of it

    // What DRBD lacks to connect at all, as "no /proc/drbd"; empty when it lacks nothing.
    std::string missingDrbd() const;
};

// Reads /proc/drbd and sysfs; any user may. What cannot be read counts as not there.
LocalState readLocalState();

}  // namespace ternhactl
