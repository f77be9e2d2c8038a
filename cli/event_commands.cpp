#include <json/writer.h>

#include <algorithm>
#include <iostream>

#include "client.h"
#include "commands.h"
#include "report.h"
#include "text.h"

namespace ternhactl {

namespace {

using Clock = Connection::Clock;

constexpr char LOST[] = "lost";  // the event in place of those that the daemon could not keep

constexpr auto NO_LIMIT = std::chrono::hours(24 * 365);

// Request the event stream. The first line of the reply is the report, which has the current state;
// each event follows as a line.
Json::Value firstLine(Connection& connection, const Deadline& deadline) {
    auto line = connection.line(deadline.time);
    if (!line) {
        throw NoAnswer("no reply within " + std::to_string(deadline.seconds) + " s");
    }
    return *line;
}

std::string text(const Json::Value& event, const char* key) {
    const Json::Value& value = event.isObject() ? event[key] : Json::Value::nullSingleton();
    return value.isString() ? value.asString() : "unknown";
}

std::string when(const Json::Value& event) {
    const Json::Value& time = event.isObject() ? event["time"] : Json::Value::nullSingleton();
    return time.isNumeric() ? timeStamp(time.asDouble()) : "unknown";
}

// The last known state of a dead peer no longer holds.
bool holds(const Report& report, const std::string& condition) {
    return std::any_of(flagNames().begin(), flagNames().end(), [&](const FlagName& name) {
        const Report::Flag& flag = report.*name.flag;
        return (condition == name.set && flag.is(true)) || (condition == name.clear && flag.is(false));
    });
}

}  // namespace

ExitCode wait(const Settings& settings) {
    const auto deadline =
        Clock::now() +
        (settings.waitLimit
             ? std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(*settings.waitLimit))
             : NO_LIMIT);
    for (;;) {
        const Deadline firstDeadline(settings.timeout);
        Connection connection(settings, "E", firstDeadline);
        if (holds(Report(firstLine(connection, firstDeadline)), settings.condition)) {
            return ExitCode::Success;
        }
        std::optional<Json::Value> line;
        do {
            line = connection.line(deadline);
            if (!line) {
                std::cerr << "ternhactl: not in time: " << settings.condition << '\n';
                return ExitCode::No;
            }
            if (text(*line, "new") == settings.condition) {
                return ExitCode::Success;
            }
        } while (text(*line, "event") != LOST);  // else see what holds now
    }
}

ExitCode events(const Settings& settings) {
    const Deadline firstDeadline(settings.timeout);
    Connection connection(settings, "E", firstDeadline);
    firstLine(connection, firstDeadline);
    Json::StreamWriterBuilder compact;
    compact["indentation"] = "";
    for (;;) {
        const auto event = connection.line(Clock::now() + NO_LIMIT);
        if (!event) {
            continue;
        }
        if (settings.json != Settings::Json::None) {
            std::cout << Json::writeString(compact, *event) << '\n' << std::flush;
        } else if (text(*event, "event") == LOST) {
            std::cout << when(*event) << ' ' << (*event)["count"].asString() << " changes lost\n"
                      << std::flush;
        } else {
            std::cout << when(*event) << ' ' << text(*event, "new") << " (was " << text(*event, "old") << ')'
                      << '\n'
                      << std::flush;
        }
    }
}

}  // namespace ternhactl
