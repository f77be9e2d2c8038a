#include <json/writer.h>
#include <syslog.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <iostream>
#include <optional>
#include <string>
#include <thread>

#include "control.h"
#include "exit_code.h"
#include "report.h"

namespace ternhactl {

namespace {

using TERN::HA::Daemon::MonitordSocket;

constexpr unsigned int REBOOT_TIMEOUT = 40;  // seconds; the daemon follows the peer down for up to 33
constexpr char CLEAR_SCREEN[] = "\033[H\033[2J";

struct Settings {
    std::string socket = "/run/ternha/control.sock";
    unsigned int timeout = 5;  // seconds
    bool asJson = false;
    double watchInterval = 0;  // seconds, 0: once
    bool isConfirmed = false;
};

ExitCode reportNoAnswer(const Settings& settings) {
    const bool isReachable = access(settings.socket.c_str(), R_OK | W_OK) == 0;
    const int error = errno;
    std::cerr << "ternhactl: ternhad does not answer on " << settings.socket;
    if (!isReachable) {
        std::cerr << ": " << std::strerror(error);
    }
    std::cerr << '\n';
    return ExitCode::NoAnswer;
}

// The status record; nothing when the daemon gave no answer, or none that is a record.
std::optional<Json::Value> fetchRecord(const Settings& settings) {
    Json::Value record;
    if (!MonitordSocket(settings.socket, settings.timeout).getServerData(record) || !record.isObject()) {
        return std::nullopt;
    }
    return record;
}

// Whether the peer is being rebooted; nothing when the daemon gave no answer.
std::optional<bool> fetchRebooting(const Settings& settings) {
    MonitordSocket socket(settings.socket, settings.timeout);
    const bool isRebooting = socket.isRebootRemote();
    if (socket.hasError()) {
        return std::nullopt;
    }
    return isRebooting;
}

std::optional<Report> fetchReport(const Settings& settings) {
    const auto record = fetchRecord(settings);
    const auto isRebooting = record ? fetchRebooting(settings) : std::nullopt;
    if (!isRebooting) {
        return std::nullopt;
    }
    Report report(*record);
    report.isPeerRebooting = *isRebooting;
    return report;
}

ExitCode printStatus(const Settings& settings, bool useColour) {
    if (settings.asJson) {
        const auto record = fetchRecord(settings);
        if (!record) {
            return reportNoAnswer(settings);
        }
        Json::StreamWriterBuilder compact;
        compact["indentation"] = "";
        std::cout << Json::writeString(compact, *record) << std::endl;
        return ExitCode::Success;
    }
    const auto report = fetchReport(settings);
    if (!report) {
        return reportNoAnswer(settings);
    }
    std::cout << statusTable(*report, useColour) << std::flush;
    return ExitCode::Success;
}

ExitCode status(const Settings& settings) {
    const bool isTerminal = isatty(STDOUT_FILENO) == 1;
    const bool useColour = isTerminal && std::getenv("NO_COLOR") == nullptr;
    if (settings.watchInterval <= 0) {
        return printStatus(settings, useColour);
    }
    while (std::cout) {
        if (isTerminal) {
            std::cout << CLEAR_SCREEN;
        }
        printStatus(settings, useColour);
        if (!isTerminal && !settings.asJson) {
            std::cout << std::endl;
        }
        std::this_thread::sleep_for(std::chrono::duration<double>(settings.watchInterval));
    }
    return ExitCode::Success;
}

ExitCode rebooting(const Settings& settings) {
    const auto isRebooting = fetchRebooting(settings);
    if (!isRebooting) {
        return reportNoAnswer(settings);
    }
    std::cout << (*isRebooting ? "yes" : "no") << '\n';
    return *isRebooting ? ExitCode::Success : ExitCode::No;
}

bool confirm() {
    std::cout << "Reboot the peer at once, without a shutdown? [y/N] " << std::flush;
    std::string answer;
    std::getline(std::cin, answer);
    return answer == "y" || answer == "Y" || answer == "yes";
}

ExitCode rebootPeer(const Settings& settings) {
    if (!settings.isConfirmed && !confirm()) {
        std::cout << "Nothing done.\n";
        return ExitCode::No;
    }
    std::cout << "Ordering the reboot and following the peer down, up to 33 seconds...\n" << std::flush;
    if (!MonitordSocket(settings.socket, REBOOT_TIMEOUT).rebootRemote()) {
        return reportNoAnswer(settings);
    }
    std::cout << "The peer counts as rebooting until it answers again.\n";
    return ExitCode::Success;
}

ExitCode disks(const Settings& settings) {
    const auto record = fetchRecord(settings);
    if (!record) {
        return reportNoAnswer(settings);
    }
    std::cout << diskList(Report(*record));
    return ExitCode::Success;
}

ExitCode check(const Settings& settings) {
    const auto report = fetchReport(settings);
    if (!report) {
        std::cout << "TERNHA UNKNOWN - ternhad does not answer on " << settings.socket << '\n';
        return ExitCode::NoAnswer;
    }
    const Verdict result = verdict(*report);
    std::cout << result.line << '\n';
    switch (result.level) {
        case Verdict::Level::Ok:
            return ExitCode::Success;
        case Verdict::Level::Warning:
            return ExitCode::No;
        case Verdict::Level::Critical:
            break;
    }
    return ExitCode::Critical;
}

ExitCode printMetrics(const Settings& settings) {
    const auto report = fetchReport(settings);
    if (!report) {
        std::cout << "# HELP ternha_up Whether the daemon answers.\n# TYPE ternha_up gauge\nternha_up 0\n";
        return reportNoAnswer(settings);
    }
    std::cout << metrics(*report);
    return ExitCode::Success;
}

int run(int argc, char** argv) {
    Settings settings;
    std::function<ExitCode(const Settings&)> command;

    CLI::App app("Asks the high-availability daemon of this node, or gives it an order.", "ternhactl");
    app.set_version_flag("--version", std::string("ternhactl ") + TERNHA_VERSION);
    app.require_subcommand(0, 1);
    app.fallthrough();
    app.add_option("--socket", settings.socket,
                   "The daemon's control socket (default " + settings.socket + ")")
        ->type_name("PATH");
    app.add_option("--timeout", settings.timeout,
                   "Seconds to wait for an answer (default " + std::to_string(settings.timeout) + ")")
        ->check(CLI::Range(1U, 3600U))
        ->type_name("SECONDS");

    const auto add = [&](const char* name, const char* description, ExitCode (*function)(const Settings&)) {
        CLI::App* const sub = app.add_subcommand(name, description);
        sub->callback([&command, function] { command = function; });
        return sub;
    };
    CLI::App* const statusApp =
        add("status", "Show what the daemon knows of both nodes and the link", status);
    statusApp->add_flag("--json", settings.asJson, "Print the daemon's record as it is, one line of JSON");
    statusApp
        ->add_option("--watch", settings.watchInterval,
                     "Show it again every SECONDS, 0.1 to 86400 (every 2 when none are given)")
        ->expected(0, 1)
        ->default_str("2")
        ->check(CLI::Range(0.1, 86400.0))
        ->type_name("SECONDS");
    add("rebooting", "Tell whether the peer is being rebooted: yes (exit code 0) or no (1)", rebooting);
    CLI::App* const reboot = add("reboot-peer", "Order the peer's reboot and follow it down", rebootPeer);
    reboot->add_flag("--yes", settings.isConfirmed, "Do not ask for confirmation");
    add("disks", "List the disks under error handling by the names that users see", disks);
    add("check", "Print one line and exit as a monitoring plugin: 0 OK, 1 warning, 2 critical, 3 unknown",
        check);
    add("metrics", "Print the figures in Prometheus' text format", printMetrics);

    try {
        app.parse(argc, argv);
        if (!command) {
            throw CLI::RequiredError("A command");
        }
    } catch (const CLI::ParseError& error) {
        return app.exit(error) == 0 ? 0 : static_cast<int>(ExitCode::WrongUsage);
    }
    openlog("ternhactl", LOG_PID, LOG_USER);
    return static_cast<int>(command(settings));
}

}  // namespace

}  // namespace ternhactl

int main(int argc, char** argv) {
    try {
        return ternhactl::run(argc, argv);
    } catch (const std::exception& error) {
        std::cerr << "ternhactl: " << error.what() << '\n';
        return static_cast<int>(ternhactl::ExitCode::NoAnswer);
    }
}
