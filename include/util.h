/// @file
/// Names that users see.

#pragma once

#include <string>
#include <vector>

#pragma GCC visibility push(default)

/// Names that users see.
namespace TERN::HA::Daemon::Util {

/// The name of the high-availability pair: "ha_hostname" of the package's configuration file, at most 63
/// characters. Empty, and "Failed to get ha hostname" in the log, when there is none. Any thread.
std::string getHAHostname();

/// The names that a user sees for the peer's disks `devices` (such as sda): "Disk 3" or "disk 3" for slot 3
/// of the main unit, "disk 3(EXP1)" for slot 3 of the enclosure EXP1. The mapping is read from
/// /tmp/ha/info_hd.remote on every call. A device that it does not hold is left out, one that it holds twice
/// appears twice. Without a mapping `devices` is returned as it is; a file that is no JSON object leaves
/// "Failed to read HD info json: " and its path in the log. Any thread.
std::vector<std::string> devListToHumanReadable(const std::vector<std::string>& devices);

}  // namespace TERN::HA::Daemon::Util

#pragma GCC visibility pop
