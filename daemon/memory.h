#pragma once

namespace ternhad {

// Give back the memory of code that only ran at the start, such as the parser of the options, and
// lock the pages used from now on, if permitted. Locking all would triple the memory use.
void lockUsedMemory() noexcept;

}  // namespace ternhad
