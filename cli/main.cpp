#include <syslog.h>

#include <CLI/CLI.hpp>
#include <cerrno>
#include <cstring>
#include <functional>
#include <iostream>
#include <sstream>
#include <string>

#include "client.h"
#include "commands.h"
#include "report.h"

namespace ternhactl {

namespace {

using Command = std::function<ExitCode(const Settings&)>;

constexpr char CHECK[] = "check";

// Not CLI::Range, whose message differs from one version of CLI11 to the next.
CLI::Validator between(double min, double max) {
    std::ostringstream limits;
    limits << min << " to " << max;
    const auto check = [range = CLI::Range(min, max), text = limits.str()](const std::string& value) {
        return range(value).empty() ? "" : "Value " + value + " not in range " + text;
    };
    return {check, limits.str()};
}

void addCommands(CLI::App& app, Settings& settings, Command& command) {
    const auto add = [&](const char* name, const char* description, ExitCode (*function)(const Settings&)) {
        CLI::App* const sub = app.add_subcommand(name, description);
        sub->callback([&command, function] { command = function; });
        return sub;
    };
    CLI::App* const statusApp = add("status", "Show the state of both nodes and the link", status);
    statusApp
        ->add_option_function<std::string>(
            "--json",
            [&settings](const std::string& form) {
                settings.json = form == "1" ? Settings::Json::Version1 : Settings::Json::Record;
            },
            "Print one line of JSON: the status record, or version 1 of the report")
        ->expected(0, 1)
        ->default_str("record")
        ->check(CLI::IsMember({"record", "1"}))
        ->type_name("record|1");
    statusApp
        ->add_option("--watch", settings.watchInterval, "Refresh every SECONDS, 0.1 to 86400 (default 2)")
        ->expected(0, 1)
        ->default_str("2")
        ->check(between(0.1, 86400))
        ->type_name("SECONDS");
    CLI::App* const waitApp = add("wait", "Wait until a condition holds; exit with 1 on timeout", wait);
    std::vector<std::string> conditions;
    for (const FlagName& name : flagNames()) {
        conditions.insert(conditions.end(), {name.set, name.clear});
    }
    waitApp->add_option("CONDITION", settings.condition, "Condition to wait for")
        ->required()
        ->check(CLI::IsMember(conditions))
        ->type_name("");
    waitApp->add_option("--timeout", settings.waitLimit, "Seconds to wait (default: no limit)")
        ->check(between(0, 1e9))
        ->type_name("SECONDS");
    add("events", "Print each state transition as it happens", events)
        ->add_flag_callback(
            "--json", [&settings] { settings.json = Settings::Json::Version1; }, "Print each as a JSON line");
    add("rebooting", "Print whether the peer is being rebooted: yes (exit code 0) or no (1)", rebooting);
    add("reboot-peer", "Reboot the peer and wait until it is down", rebootPeer)
        ->add_flag("--yes", settings.isConfirmed, "Do not ask for confirmation");
    add("disks", "List the disks under error handling by their human-readable names", disks);
    add(CHECK, "Monitoring plugin: print one line and exit with 0 OK, 1 warning, 2 critical or 3 unknown",
        check)
        ->add_flag("--self", settings.isSelfOnly, "Check this node only: ignore peer and link");
    add("metrics", "Print metrics in the text format of Prometheus", printMetrics)
        ->add_option("--output", settings.output, "Replace FILE atomically instead of printing")
        ->check([](const std::string& file) { return file.empty() ? "The name of FILE is empty" : ""; })
        ->type_name("FILE");
}

// Print the one line of a plugin whose result is unknown.
ExitCode unknown(const std::string& reason) {
    std::string line = reason.substr(0, reason.find('\n'));
    for (char& c : line) {
        c = c == '|' ? '/' : c;  // it would start performance data
    }
    std::cout << "TERNHA UNKNOWN - " << line << '\n' << std::flush;
    return ExitCode::NoAnswer;
}

std::string noAnswer(const Settings& settings, const std::string& reason) {
    if (reason.rfind(REFUSAL, 0) == 0) {
        return "ternhad on " + settings.socket + ' ' + reason;
    }
    return "ternhad does not answer on " + settings.socket + ": " + reason;
}

// To be called right after a failed write. error: errno
ExitCode outputError(int error, ExitCode code) {
    std::cerr << "ternhactl: cannot write to standard output: " << std::strerror(error) << '\n';
    return code;
}

ExitCode run(const Command& command, const Settings& settings, bool isPlugin) {
    ExitCode code = ExitCode::Success;
    try {
        code = command(settings);
    } catch (const std::ios::failure&) {
        throw;
    } catch (const NoAnswer& error) {
        if (isPlugin) {
            return unknown(noAnswer(settings, error.what()));
        }
        complain(settings, error.what());
        code = ExitCode::NoAnswer;
    } catch (const std::exception& error) {
        if (!isPlugin) {
            throw;
        }
        return unknown(error.what());
    }
    std::cout.flush();
    return code;
}

ExitCode run(int argc, char** argv, bool& isPlugin) {
    Settings settings;
    Command command;
    CLI::App app("Query and control the high-availability daemon of this node.", "ternhactl");
    app.set_version_flag("--version", std::string("ternhactl ") + TERNHA_VERSION);
    app.require_subcommand(0, 1);
    app.fallthrough();
    app.add_option("--socket", settings.socket,
                   "The daemon's control socket (default " + settings.socket + ")")
        ->type_name("PATH");
    app.add_option("--timeout", settings.timeout,
                   "Seconds to wait for a reply (default " + std::to_string(settings.timeout) + ")")
        ->check(between(1, 3600))
        ->type_name("SECONDS");
    addCommands(app, settings, command);

    try {
        app.parse(argc, argv);
        if (!command) {
            throw CLI::RequiredError("A command");
        }
    } catch (const CLI::ParseError& error) {
        if (error.get_exit_code() != 0 && app.got_subcommand(CHECK)) {
            isPlugin = true;
            return unknown(error.what());
        }
        const ExitCode code = app.exit(error) == 0 ? ExitCode::Success : ExitCode::WrongUsage;
        std::cout.flush();
        return code;
    }
    openlog("ternhactl", LOG_PID, LOG_USER);
    isPlugin = app.got_subcommand(CHECK);
    return run(command, settings, isPlugin);
}

}  // namespace

void complain(const Settings& settings, const char* reason) {
    std::cerr << "ternhactl: " << noAnswer(settings, reason) << '\n';
}

}  // namespace ternhactl

int main(int argc, char** argv) try {
    using ternhactl::ExitCode;
    bool isPlugin = false;
    try {
        // Throw where a write fails, because errno has the cause there.
        std::cout.exceptions(std::ios::badbit | std::ios::failbit);
        return static_cast<int>(ternhactl::run(argc, argv, isPlugin));
    } catch (const std::ios::failure&) {
        const int error = errno;
        std::cout.exceptions(std::ios::goodbit);  // it is flushed again at exit
        const auto code = isPlugin ? ExitCode::NoAnswer : ExitCode::OutputError;
        return static_cast<int>(ternhactl::outputError(error, code));
    }
} catch (const std::exception& error) {
    std::cerr << "ternhactl: " << error.what() << '\n';
    return static_cast<int>(ternhactl::ExitCode::NoAnswer);
}
