#pragma once

#include <json/value.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "settings.h"

namespace ternhactl {

// The daemon's state, read from its report (version 1). Values that are missing, null or of a wrong
// type are unknown. Times are seconds since 1970.
struct Report {
    struct Flag {
        std::optional<bool> value;
        std::optional<double> since;
        std::optional<std::uint64_t> changes;
        std::optional<double> checked;  // when a check last confirmed the value
        bool isStale = false;           // the value is the last known one

        bool isKnown() const { return value && !isStale; }
        bool is(bool expected) const { return isKnown() && value == expected; }
        std::optional<bool> current() const { return isStale ? std::nullopt : value; }
    };
    struct Figure {
        std::optional<double> value;
        std::optional<double> time;  // of the measurement
        bool isStale = false;

        std::optional<double> current() const { return isStale ? std::nullopt : value; }
    };

    explicit Report(const Json::Value& json);

    std::optional<double> time;     // of the report
    std::string version;            // of the daemon; empty for older ones
    std::optional<double> started;  // the daemon
    std::string node;               // name, else address, else "this node"
    std::string peer;               // the same of the peer
    std::optional<double> lastReply;

    Flag peerAlive;
    Flag peerRebooting;
    std::string orderOutcome;  // of the latest order to reboot it; empty when there was none
    Flag peerResync;
    Flag peerDiskErrors;
    std::optional<std::vector<std::string>> peerDisks;  // device names

    // The peer handles errors of more disks than its report can name.
    bool hasTooManyPeerDisks() const {
        return peerDiskErrors.value == true && (!peerDisks || peerDisks->empty());
    }
    Flag connected;
    Flag resync;
    Flag diskErrors;
    std::vector<std::string> disks;  // device names
    Figure latency;                  // milliseconds
    Figure nonOkRate;                // 0 to 1
};

inline constexpr char TOO_MANY_DISKS[] = "more disks than a report holds";

using FlagMember = Report::Flag Report::*;

// A flag of the report with its names: in events and metrics, and of both its conditions.
struct FlagName {
    const char* name;
    const char* set;
    const char* clear;
    FlagMember flag;
};
const std::vector<FlagName>& flagNames();

// Return the daemon's status record as it is. Throws NoAnswer.
Json::Value fetchRecord(const Settings& settings);

// Return version 1 of the daemon's report; built from the status record for older daemons. Throws
// NoAnswer.
Json::Value fetchReport(const Settings& settings);

}  // namespace ternhactl
