#pragma once

#include <string>

namespace test {

// Puts the programs of the recipes, and ternhad and ternhactl where their package has them, beside the
// machine's: from then on, and in nodes made afterwards.
void installPrograms();

// The file that docs/recipes.md shows under its path, as in "`/etc/x` ...:".
std::string recipe(const std::string& path);

}  // namespace test
