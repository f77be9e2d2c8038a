#pragma once

#include <string>
#include <vector>

#include "local_state.h"
#include "report.h"

namespace ternhactl {

// Whether a failover is safe.
struct Verdict {
    enum class Level { Ok, Warning, Critical, Unknown };

    Level level = Level::Ok;
    std::vector<std::string> reasons;  // the worst first; at least one

    const char* word() const;  // "OK", "WARNING", "CRITICAL", "UNKNOWN"
};

Verdict verdict(const Report& report, const LocalState& local);

// Whether this node could serve alone, regardless of the peer and the link.
Verdict verdictOfNode(const Report& report, const LocalState& local);

// The line that monitoring plugins print, with performance data if a report is given.
std::string pluginLine(const Verdict& verdict);
std::string pluginLine(const Report& report, const Verdict& verdict);

}  // namespace ternhactl
