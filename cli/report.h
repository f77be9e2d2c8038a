#pragma once

#include <json/value.h>

#include <string>
#include <vector>

namespace ternhactl {

// The daemon's status record, read defensively: what is missing or of a wrong type has its neutral value.
struct Report {
    explicit Report(const Json::Value& record);

    bool isPeerAlive;
    bool isPeerResync;
    bool isPeerDiskErrHandling;
    std::vector<std::string> peerDisks;  // device names
    bool isDrbdConnected;
    bool isResync;
    bool isDiskErrHandling;
    std::vector<std::string> disks;  // device names
    double latency;                  // milliseconds
    double nonOkRate;                // 0 to 1

    bool isPeerRebooting = false;  // not part of the record: asked for by itself
};

// The table that `status` prints; with terminal colours if `useColour`.
std::string statusTable(const Report& report, bool useColour);

// The names that users see for the disks under error handling on both nodes, a line each.
std::string diskList(const Report& report);

// Prometheus' text format.
std::string metrics(const Report& report);

struct Verdict {
    enum class Level { Ok, Warning, Critical } level;
    std::string line;  // in the form that monitoring plugins print
};

Verdict verdict(const Report& report);

}  // namespace ternhactl
