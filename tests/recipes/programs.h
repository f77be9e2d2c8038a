#pragma once

#include <string>

namespace test {

// Add the programs of the recipes, and ternhad and ternhactl at their installed paths, to the
// sandbox and to nodes created afterwards.
void installPrograms();

// Return the file that docs/recipes.md shows after its path, as in "`/etc/x` ...:".
std::string recipe(const std::string& path);

}  // namespace test
