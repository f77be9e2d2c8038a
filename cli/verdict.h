#pragma once

#include <string>
#include <vector>

#include "local_state.h"
#include "report.h"

namespace ternhactl {

// Whether a failover would go well.
struct Verdict {
    enum class Level { Ok, Warning, Critical, Unknown };

    Level level = Level::Ok;
    std::vector<std::string> reasons;  // the worst first; one at least

    const char* word() const;  // "OK", "WARNING", "CRITICAL", "UNKNOWN"
};

Verdict verdict(const Report& report, const LocalState& local);

// Whether this node could serve alone: the peer and the link to it do not count.
Verdict verdictOfNode(const Report& report, const LocalState& local);

// The one line that monitoring plugins print, with the figures where a report is given.
std::string pluginLine(const Verdict& verdict);
std::string pluginLine(const Report& report, const Verdict& verdict);

}  // namespace ternhactl
