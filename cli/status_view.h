#pragma once

#include <optional>
#include <string>
#include <vector>

#include "local_state.h"
#include "report.h"

namespace ternhactl {

// The headline and the table that `status` prints. With `useColour`, problems are red and stale
// values dim.
std::string statusView(const Report& report, const LocalState& local, bool useColour);

// `text`, dim if `useColour`.
std::string dimmed(const std::string& text, bool useColour);

// The human-readable names of the disks under error handling on both nodes, one per line.
std::string diskList(const Report& report);

// Format values as a line of blocks, the largest one as a full block, unknown ones as dots.
std::string blocks(const std::vector<std::optional<double>>& values);

}  // namespace ternhactl
