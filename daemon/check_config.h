#pragma once

#include <string>
#include <vector>

#include "options.h"

namespace ternhad {

// The values in effect, in the format of the configuration file.
std::string configurationText(const Options& options);

// What is allowed but hardly meant, or not so yet. When only the configuration is checked this includes what
// the start itself would show.
std::vector<std::string> warningsOf(const Options& options);

}  // namespace ternhad
