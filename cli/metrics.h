#pragma once

#include <string>

#include "local_state.h"
#include "report.h"
#include "verdict.h"

namespace ternhactl {

// Format in the text format of Prometheus. Unknown and stale values have no sample.
std::string metrics(const Report& report, const LocalState& local, const Verdict& verdict);

// The same while the daemon does not reply.
std::string metricsOfNoDaemon();

// Atomically replace `path` by a file that everybody can read. Throws std::system_error.
void writeAtomically(const std::string& path, const std::string& text);

}  // namespace ternhactl
