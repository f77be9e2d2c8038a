#pragma once

#include <array>
#include <cstddef>
#include <optional>

namespace ternhad {

// State of the two nodes whose transitions are events.
enum class Flag { peerAlive, peerRebooting, peerResync, peerDiskErrors, drbdConnected, resync, diskErrors };
constexpr std::size_t FLAGS = 7;

// Names of a flag in events: its own, and those of its two conditions.
struct FlagName {
    const char* name;
    const char* set;
    const char* clear;
    bool isSetGood;
};

inline const FlagName& nameOf(Flag flag) {
    static constexpr std::array<FlagName, FLAGS> NAMES = {{
        {"peer", "peer-alive", "peer-dead", true},
        {"peer-reboot", "peer-rebooting", "peer-not-rebooting", false},
        {"peer-resync", "peer-resync", "peer-no-resync", false},
        {"peer-disk-errors", "peer-disk-errors", "peer-no-disk-errors", false},
        {"drbd", "connected", "not-connected", true},
        {"resync", "resync", "no-resync", false},
        {"disk-errors", "disk-errors", "no-disk-errors", false},
    }};
    return NAMES.at(static_cast<std::size_t>(flag));
}

// Whether the flag is known only from the peer's replies.
inline bool isReportedByPeer(Flag flag) {
    return flag == Flag::peerResync || flag == Flag::peerDiskErrors;
}

inline const char* conditionOf(Flag flag, std::optional<bool> value) {
    if (!value) {
        return "unknown";
    }
    return *value ? nameOf(flag).set : nameOf(flag).clear;
}

}  // namespace ternhad
