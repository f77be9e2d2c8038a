#include "options.h"

#include <arpa/inet.h>
#include <net/if.h>
#include <sys/un.h>

#include <CLI/CLI.hpp>

namespace ternhad {

namespace {

constexpr int WRONG_USAGE = 2;
constexpr double DAY = 86400;

// As the library reads it: text that is no address to it, such as 010.0.0.1, would count as 0.0.0.0.
std::string checkAddress(const std::string& text) {
    in_addr address = {};
    return inet_pton(AF_INET, text.c_str(), &address) == 1 ? "" : "not an IPv4 address: " + text;
}

// A path that is bound as it is: neither relative to wherever the process stands nor cut.
std::string checkSocketPath(const std::string& path) {
    if (path.empty() || path.front() != '/') {
        return "not an absolute path: " + path;
    }
    if (path.size() >= sizeof(sockaddr_un::sun_path)) {
        return "longer than 107 characters: " + path;
    }
    return {};
}

std::string checkInterfaceName(const std::string& name) {
    if (name.empty() || name.size() >= IF_NAMESIZE || name.find_first_of("/ \t") != std::string::npos) {
        return "not the name of a network interface: " + name;
    }
    return {};
}

// Not by CLI::Range, to which "nan" is in every range.
void addInterval(CLI::App& app, const std::string& name, Seconds& value, double least, double most,
                 const std::string& description) {
    const std::string range = "from " + CLI::detail::to_string(least) + " to " + CLI::detail::to_string(most);
    app.add_option_function<double>(
           name,
           [&value, name, range, least, most](double seconds) {
               if (!(seconds >= least && seconds <= most)) {
                   throw CLI::ValidationError(name, "not in the range " + range);
               }
               value = Seconds(seconds);
           },
           description + ", seconds " + range + " (default " + CLI::detail::to_string(value.count()) + ")")
        ->type_name("SECONDS");
}

}  // namespace

std::optional<int> parseOptions(int argc, const char* const* argv, Options& options) {
    CLI::App app(
        "High-availability daemon of one node: watches its peer over the replication link, answers the "
        "peer's "
        "questions and serves the control socket. Runs in the foreground until SIGTERM; SIGHUP moves and "
        "rotates the logs.",
        "ternhad");
    app.set_version_flag("--version", std::string("ternhad ") + TERNHA_VERSION);
    app.set_config("--config", "", "Read options from this file, a line NAME = VALUE each");
    app.allow_config_extras(CLI::config_extras_mode::error);

    app.add_option("--local-ip", options.localIp, "This node's address on the replication link")
        ->required()
        ->check(checkAddress)
        ->type_name("ADDRESS");
    app.add_option("--remote-ip", options.remoteIp, "The peer's address on the replication link")
        ->required()
        ->check(checkAddress)
        ->type_name("ADDRESS");
    app.add_option("--interface", options.interface, "The network interface of the replication link")
        ->required()
        ->check(checkInterfaceName)
        ->type_name("NAME");
    app.add_option("--socket", options.socket, "The control socket (default " + options.socket + ")")
        ->check(checkSocketPath)
        ->type_name("PATH");
    addInterval(app, "--check-interval", options.checkInterval, 0.05, DAY,
                "Between two liveness probes, and between two rounds of local and peer checks");
    addInterval(app, "--dead-after", options.deadAfter, 0.2, 60,
                "Without proof of life after which the peer is dead");
    addInterval(app, "--heartbeat-interval", options.heartbeatInterval, 0.1, DAY,
                "Between two measurements of the link's latency and the interface's packet rate");
    addInterval(app, "--log-interval", options.logInterval, 0.1, DAY,
                "Between two moves of the logs to disk");
    addInterval(app, "--snapshot-interval", options.snapshotInterval, 0.1, DAY,
                "Between two recordings of status, processes, file systems and memory");
    app.add_option(
           "--rotate-size", options.rotateSize,
           "Size at which a log is rotated, bytes (default " + std::to_string(options.rotateSize) + ")")
        ->check(CLI::Range(std::int64_t{4096}, std::int64_t{1} << 40))
        ->type_name("BYTES");

    try {
        app.parse(argc, argv);
        if (options.localIp == options.remoteIp) {
            throw CLI::ValidationError("--remote-ip", "the same address as --local-ip");
        }
        if (options.checkInterval * 3 > options.deadAfter) {
            throw CLI::ValidationError("--check-interval", "above a third of --dead-after");
        }
    } catch (const CLI::ParseError& error) {
        return app.exit(error) == 0 ? 0 : WRONG_USAGE;
    }
    return std::nullopt;
}

}  // namespace ternhad
