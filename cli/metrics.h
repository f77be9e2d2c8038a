#pragma once

#include <string>

#include "local_state.h"
#include "report.h"
#include "verdict.h"

namespace ternhactl {

// Prometheus' text format. What is unknown or stale has no sample.
std::string metrics(const Report& report, const LocalState& local, const Verdict& verdict);

// The same when the daemon does not answer.
std::string metricsOfNoDaemon();

// Replaces `path` in one step, readable by all: a collector sees the old text or the new one. Throws
// std::system_error.
void writeAtomically(const std::string& path, const std::string& text);

}  // namespace ternhactl
