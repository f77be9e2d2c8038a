#include <json/writer.h>
#include <unistd.h>

#include <cstdlib>
#include <iostream>
#include <thread>

#include "client.h"
#include "commands.h"
#include "status_view.h"
#include "text.h"

namespace ternhactl {

namespace {

constexpr char CLEAR_SCREEN[] = "\033[H\033[2J";
constexpr std::size_t HISTORY = 60;  // number of latencies in the graph

std::string compact(const Json::Value& value) {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    return Json::writeString(builder, value) + '\n';
}

std::string asJson(const Settings& settings) {
    return compact(settings.json == Settings::Json::Record ? fetchRecord(settings) : fetchReport(settings));
}

// Print the status repeatedly; when the daemon stops, the last one stays on the screen.
class Watch {
 public:
    Watch(const Settings& settings, bool useColour) : _settings(settings), _useColour(useColour) {}

    std::string next() {
        const double now = currentTime();
        std::string text = timeOf(now, now) + '\n';
        try {
            const Report report(fetchReport(_settings));
            _last = statusView(report, readLocalState(), _useColour);
            _lastAsPlainText = statusView(report, readLocalState(), false);
            _time = now;
            remember(report);
            text += _last;
        } catch (const NoAnswer& error) {
            remember({});
            text += "ternhad does not answer on " + _settings.socket + ": " + error.what() + '\n';
            if (!_last.empty()) {
                text += dimmed("Last status, " + duration(now - _time) + " ago:\n" + _lastAsPlainText,
                               _useColour);
            }
        }
        return text + "  latency           " + blocks(_latencies) + '\n';
    }

 private:
    void remember(const std::optional<double>& latency) {
        _latencies.push_back(latency);
        if (_latencies.size() > HISTORY) {
            _latencies.erase(_latencies.begin());
        }
    }

    void remember(const Report& report) { remember(report.latency.current()); }

    const Settings& _settings;
    bool _useColour;
    std::string _last;
    std::string _lastAsPlainText;
    double _time = 0;
    std::vector<std::optional<double>> _latencies;
};

}  // namespace

ExitCode status(const Settings& settings) {
    const bool isTerminal = isatty(STDOUT_FILENO) == 1;
    const bool useColour = isTerminal && std::getenv("NO_COLOR") == nullptr;
    const bool asRecords = settings.json != Settings::Json::None;
    if (settings.watchInterval <= 0) {
        std::cout << (asRecords ? asJson(settings)
                                : statusView(Report(fetchReport(settings)), readLocalState(), useColour));
        return ExitCode::Success;
    }
    Watch watch(settings, useColour);
    for (;;) {
        if (asRecords) {
            try {
                std::cout << asJson(settings) << std::flush;
            } catch (const NoAnswer& error) {
                complain(settings, error.what());
            }
        } else {
            const std::string text = watch.next();
            std::cout << (isTerminal ? CLEAR_SCREEN + text : text + '\n') << std::flush;
        }
        std::this_thread::sleep_for(std::chrono::duration<double>(settings.watchInterval));
    }
}

}  // namespace ternhactl
