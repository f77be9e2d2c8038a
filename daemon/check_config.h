#pragma once

#include <string>
#include <vector>

#include "options.h"

namespace ternhad {

// Return the values in effect in the format of the configuration file.
std::string configurationText(const Options& options);

// Return warnings about values that are valid but probably wrong.
std::vector<std::string> warningsOf(const Options& options);

}  // namespace ternhad
