#include <iostream>
#include <system_error>

#include "client.h"
#include "commands.h"
#include "metrics.h"
#include "status_view.h"
#include "verdict.h"

namespace ternhactl {

ExitCode check(const Settings& settings) {
    const Report report(fetchReport(settings));
    const LocalState local = readLocalState();
    const Verdict result = settings.isSelfOnly ? verdictOfNode(report, local) : verdict(report, local);
    std::cout << (settings.isSelfOnly ? pluginLine(result) : pluginLine(report, result)) << '\n';
    return static_cast<ExitCode>(result.level);  // levels are the exit codes of monitoring plugins
}

ExitCode printMetrics(const Settings& settings) {
    ExitCode code = ExitCode::Success;
    std::string text;
    try {
        const Report report(fetchReport(settings));
        const LocalState local = readLocalState();
        text = metrics(report, local, verdict(report, local));
    } catch (const NoAnswer& error) {
        complain(settings, error.what());
        text = metricsOfNoDaemon();
        code = ExitCode::NoAnswer;
    }
    if (settings.output.empty()) {
        std::cout << text;
        return code;
    }
    try {
        writeAtomically(settings.output, text);
    } catch (const std::system_error& error) {
        std::cerr << "ternhactl: cannot write " << error.what() << '\n';
        return ExitCode::OutputError;
    }
    return code;
}

ExitCode disks(const Settings& settings) {
    std::cout << diskList(Report(fetchReport(settings)));
    return ExitCode::Success;
}

}  // namespace ternhactl
