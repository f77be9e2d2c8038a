#pragma once

#include <set>
#include <string>
#include <vector>

namespace sandbox {

/// What a daemon under test would leave on the machine if it escaped: its files with size and time of change,
/// and its sockets. One line of text each.
using MachineState = std::set<std::string>;

MachineState observeMachine();

/// One line per difference, "+" for what is new and "-" for what is gone.
std::vector<std::string> differences(const MachineState& before, const MachineState& after);

}  // namespace sandbox
