#pragma once

#include <optional>
#include <string>
#include <vector>

#include "local_state.h"
#include "report.h"

namespace ternhactl {

// The headline and the table that `status` prints. With `useColour` trouble is red, and what is stale dim.
std::string statusView(const Report& report, const LocalState& local, bool useColour);

// `text`, dim if `useColour`.
std::string dimmed(const std::string& text, bool useColour);

// The names that users see for the disks under error handling on both nodes, a line each.
std::string diskList(const Report& report);

// Values as a line of blocks, the largest one as a full block; a dot for one that is unknown.
std::string blocks(const std::vector<std::optional<double>>& values);

}  // namespace ternhactl
