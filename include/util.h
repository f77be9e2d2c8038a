/// @file
/// Human-readable names.

#pragma once

#include <string>
#include <vector>

#pragma GCC visibility push(default)

/// Human-readable names.
namespace TERN::HA::Daemon::Util {

/// Return the hostname of the HA pair: the value of "ha_hostname" in the package's configuration
/// file, at most 63 characters. Returns the empty string and logs "Failed to get ha hostname" when
/// the file or the key is missing. Blocks for the reading of a small file. Thread-safe.
std::string getHAHostname();

/// Translate device names of the peer's disks (such as "sda") into human-readable names: "Disk 3"
/// or "disk 3" for slot 3 of the main unit, "disk 3(EXP1)" for slot 3 of the enclosure EXP1.
///
/// The table of disks is read from /tmp/ha/info_hd.remote on every call. Returns the names in the
/// order of `devices`; a device without an entry is left out, one with two entries yields two
/// names. Returns `devices` unchanged when the table is missing, empty or invalid. Logs "Failed to
/// read HD info json: " and the path when the table exists but is not a regular file, is larger
/// than 1 MiB, or cannot be opened or parsed. Blocks for the reading of a small file. Thread-safe.
std::vector<std::string> devListToHumanReadable(const std::vector<std::string>& devices);

}  // namespace TERN::HA::Daemon::Util

#pragma GCC visibility pop
