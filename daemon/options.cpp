#include "options.h"

#include <arpa/inet.h>
#include <grp.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <iostream>
#include <memory>
#include <utility>
#include <vector>

#include "config_file.h"
#include "printable.h"

namespace ternhad {

namespace {

constexpr int FAILURE = 1;
constexpr int WRONG_USAGE = 2;
constexpr double DAY = 86400;
constexpr Seconds ROUNDING = std::chrono::nanoseconds(1);  // 3 * 0.2 is more than 0.6

// Parsed as the library does: an unparsable address such as 010.0.0.1 would count as 0.0.0.0.
std::string checkAddress(const std::string& text) {
    in_addr address = {};
    if (inet_pton(AF_INET, text.c_str(), &address) != 1) {
        return "not an IPv4 address: " + text;
    }
    const in_addr_t value = ntohl(address.s_addr);
    if (value == INADDR_ANY || IN_MULTICAST(value) || value == INADDR_BROADCAST) {
        return "not the address of one node: " + text;
    }
    return {};
}

in_addr_t valueOf(const sockaddr* address) {
    sockaddr_in copy = {};
    std::memcpy(&copy, address, sizeof copy);  // `address` may be unaligned
    return ntohl(copy.sin_addr.s_addr);
}

// Return true for the broadcast address of a network of this machine. Not by ifa_broadaddr, which
// is the remote address of point-to-point interfaces.
bool isBroadcast(const std::string& address) {
    in_addr wanted = {};
    inet_pton(AF_INET, address.c_str(), &wanted);
    ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) {
        return false;
    }
    const std::unique_ptr<ifaddrs, decltype(&freeifaddrs)> owner(list, freeifaddrs);
    for (const ifaddrs* entry = list; entry != nullptr; entry = entry->ifa_next) {
        if (entry->ifa_addr == nullptr || entry->ifa_addr->sa_family != AF_INET ||
            entry->ifa_netmask == nullptr) {
            continue;
        }
        const in_addr_t hosts = ~valueOf(entry->ifa_netmask);
        // A network of one or two addresses has no broadcast address.
        if (hosts > 1 && ntohl(wanted.s_addr) == (valueOf(entry->ifa_addr) | hosts)) {
            return true;
        }
    }
    return false;
}

// Accept only paths that are bound unchanged: absolute and not truncated.
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
    if (name.empty() || name.size() >= IF_NAMESIZE ||
        !std::all_of(name.begin(), name.end(), [](char c) { return c > ' ' && c < 0x7f && c != '/'; })) {
        return "not the name of a network interface: " + printable(name);
    }
    return {};
}

std::string checkProgram(const std::string& path) {
    struct stat info = {};
    if (path.empty() || path.front() != '/') {
        return "not an absolute path: " + path;
    }
    if (stat(path.c_str(), &info) != 0) {
        return path + ": " + std::strerror(errno);
    }
    return S_ISREG(info.st_mode) && access(path.c_str(), X_OK) == 0 ? "" : "not an executable file: " + path;
}

std::string checkGroup(const std::string& name) {
    return getgrnam(name.c_str()) != nullptr ? "" : "no such group: " + name;
}

// Not CLI::Range, which accepts "nan" in every range.
void addInterval(CLI::App& app, const std::string& name, Seconds& value, double least, double most,
                 const std::string& description) {
    const std::string range = "from " + CLI::detail::to_string(least) + " to " + CLI::detail::to_string(most);
    app.add_option_function<double>(
           name,
           [&value, name, range, least, most](double seconds) {
               const bool isInRange = seconds >= least && seconds <= most;  // "nan" is not
               if (!isInRange) {
                   throw CLI::ValidationError(name, "not in the range " + range);
               }
               value = Seconds(seconds);
           },
           description + ", " + range + " (default " + CLI::detail::to_string(value.count()) + ")")
        ->type_name("SECONDS");
}

}  // namespace

bool isPrinted() {
    std::cout.flush();
    if (!std::cout) {
        std::cerr << "ternhad: cannot write to standard output: " << std::strerror(errno) << '\n';
        return false;
    }
    return true;
}

std::optional<int> parseOptions(int argc, const char* const* argv, Options& options) {
    CLI::App app(
        "High-availability daemon of one node: watches its peer over the replication link, replies to the "
        "peer's requests and serves the control socket. Runs in the foreground until SIGTERM; SIGHUP moves "
        "and rotates the logs.",
        "ternhad");
    app.set_version_flag("--version", std::string("ternhad ") + TERNHA_VERSION);
    app.set_config("--config", "", "Read options from FILE, one NAME = VALUE per line")->type_name("FILE");
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
                "Seconds between two liveness probes and two rounds of local and peer checks");
    addInterval(app, "--dead-after", options.deadAfter, 0.2, 60,
                "Seconds without proof that the peer is alive, after which it is declared dead");
    addInterval(app, "--heartbeat-interval", options.heartbeatInterval, 0.1, DAY,
                "Seconds between two measurements of the link's latency and the interface's packet rate");
    addInterval(app, "--log-interval", options.logInterval, 0.1, DAY,
                "Seconds between two moves of the logs to disk");
    addInterval(app, "--snapshot-interval", options.snapshotInterval, 0.1, DAY,
                "Seconds between two snapshots of status, processes, file systems and memory");
    app.add_option(
           "--rotate-size", options.rotateSize,
           "Size in bytes at which a log is rotated (default " + std::to_string(options.rotateSize) + ")")
        ->check(CLI::Range(std::int64_t{4096}, std::int64_t{1} << 40))
        ->type_name("BYTES");

    app.add_option("--notify", options.notify, "Run this program at each state transition")
        ->check(checkProgram)
        ->type_name("PROGRAM");
    CLI::Option* const statusSocket =
        app.add_option("--status-socket", options.statusSocket, "A second, read-only socket")
            ->check(checkSocketPath)
            ->type_name("PATH");
    app.add_option("--status-group", options.statusGroup, "The group that may use the status socket")
        ->check(checkGroup)
        ->needs(statusSocket)
        ->type_name("GROUP");
    app.add_flag("--check-config", options.isCheckOnly, "Print the values in effect and warnings, and exit")
        ->configurable(false);
    const auto file = std::make_shared<ConfigFile>(app);
    app.config_formatter(file);

    try {
        app.parse(argc, argv);
        if (options.localIp == options.remoteIp) {
            throw CLI::ValidationError("--remote-ip", "the same address as --local-ip");
        }
        for (const auto& [name, address] :
             {std::pair{"--local-ip", options.localIp}, std::pair{"--remote-ip", options.remoteIp}}) {
            if (isBroadcast(address)) {
                throw CLI::ValidationError(name, "the broadcast address of a network: " + address);
            }
        }
        if (options.checkInterval * 3 > options.deadAfter + ROUNDING) {
            throw CLI::ValidationError("--check-interval", "above a third of --dead-after");
        }
        if (!options.statusSocket.empty()) {
            if (options.statusGroup.empty()) {
                throw CLI::ValidationError("--status-socket", "needs --status-group");
            }
            if (std::filesystem::path(options.statusSocket).lexically_normal() ==
                std::filesystem::path(options.socket).lexically_normal()) {
                throw CLI::ValidationError("--status-socket", "the same path as --socket");
            }
            options.statusGroupId = getgrnam(options.statusGroup.c_str())->gr_gid;
        }
    } catch (const CLI::ParseError& error) {
        const std::string located = file->located(error, std::vector<std::string>(argv, argv + argc));
        if (!located.empty()) {
            std::cerr << "ternhad: " << located << '\n';
            return WRONG_USAGE;
        }
        if (app.exit(error) != 0) {
            return WRONG_USAGE;
        }
        return isPrinted() ? 0 : FAILURE;
    }
    return std::nullopt;
}

}  // namespace ternhad
