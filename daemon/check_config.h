#pragma once

#include <string>
#include <vector>

#include "options.h"

namespace ternhad {

// Return the values in effect in the format of the configuration file.
std::string configurationText(const Options& options);

// What is allowed but hardly meant, or not so yet.
std::vector<std::string> warningsOf(const Options& options);

}  // namespace ternhad
