#include "metrics.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <iomanip>
#include <sstream>
#include <system_error>

namespace ternhactl {

namespace {

constexpr mode_t READABLE = 0644;
constexpr int DIGITS = 15;

class Text {
 public:
    void family(const char* name, const char* type, const char* help) {
        _text << "# HELP " << name << ' ' << help << "\n# TYPE " << name << ' ' << type << '\n';
    }

    void sample(const std::string& name, double value) {
        _text << name << ' ' << std::setprecision(DIGITS) << value << '\n';
    }

    void gauge(const char* name, const char* help, const std::optional<double>& value) {
        if (value) {
            family(name, "gauge", help);
            sample(name, *value);
        }
    }

    void gauge(const char* name, const char* help, const Report::Flag& flag) {
        const auto value = flag.current();
        gauge(name, help, value ? std::optional<double>(*value ? 1 : 0) : std::nullopt);
    }

    std::string str() const { return _text.str(); }

 private:
    std::ostringstream _text;
};

// Escape device names, which come from the kernel or the peer.
std::string quoted(const std::string& text) {
    std::string escaped = "\"";
    for (const char c : text) {
        if (c == '\\' || c == '"') {
            escaped += '\\';
        }
        if (c == '\n') {
            escaped += "\\n";
        } else {
            escaped += c;
        }
    }
    return escaped + '"';
}

void addUp(Text& text, bool isUp) {
    text.gauge("ternha_up", "Whether the daemon answers.", isUp ? 1.0 : 0.0);
}

void addDaemon(Text& text, const Report& report) {
    if (!report.version.empty()) {
        text.family("ternha_build_info", "gauge", "The daemon's version, constantly 1.");
        text.sample("ternha_build_info{version=" + quoted(report.version) + '}', 1);
    }
    text.gauge("ternha_start_time_seconds", "When the daemon started, since 1970.", report.started);
}

void addPeer(Text& text, const Report& report) {
    text.gauge("ternha_peer_alive", "Whether the peer is alive.", report.peerAlive);
    text.gauge("ternha_peer_last_reply_timestamp_seconds", "When the peer replied last, since 1970.",
               report.lastReply);
    text.gauge("ternha_peer_rebooting", "Whether the peer is being rebooted.", report.peerRebooting);
    text.gauge("ternha_peer_md_resync", "Whether the peer resynchronises a RAID array.", report.peerResync);
    text.gauge("ternha_peer_disk_error_handling", "Whether the peer handles disk errors.",
               report.peerDiskErrors);
}

void addNode(Text& text, const Report& report) {
    text.gauge("ternha_md_resync", "Whether this node resynchronises a RAID array.", report.resync);
    text.gauge("ternha_disk_error_handling", "Whether this node handles disk errors.", report.diskErrors);
}

void addLink(Text& text, const Report& report, const LocalState& local) {
    if (local.unsupportedDrbd.empty()) {
        text.gauge("ternha_drbd_connected", "Whether the DRBD link is up.", report.connected);
    } else {
        text.family("ternha_drbd_unsupported", "gauge", "This node's DRBD is not 8.4, constantly 1.");
        text.sample("ternha_drbd_unsupported{version=" + quoted(local.unsupportedDrbd) + '}', 1);
    }
    if (const auto latency = report.latency.current()) {
        text.gauge("ternha_heartbeat_latency_seconds", "Average round trip to the peer.", *latency / 1000);
    }
    text.gauge("ternha_interface_non_ok_ratio",
               "Share of packets of the replication interface that were not OK.", report.nonOkRate.current());
}

void addDisks(Text& text, const Report& report) {
    text.family("ternha_disk_error", "gauge",
                "Disks under error handling, of this node (self) and its peer.");
    const auto add = [&text](const char* owner, const std::vector<std::string>& devices) {
        for (const std::string& device : devices) {
            text.sample(
                std::string("ternha_disk_error{owner=\"") + owner + "\",device=" + quoted(device) + '}', 1);
        }
    };
    if (!report.diskErrors.isStale) {
        add("self", report.disks);
    }
    if (report.peerDisks && !report.peerDiskErrors.isStale) {
        add("peer", *report.peerDisks);
    }
}

void addTransitions(Text& text, const Report& report) {
    bool isFirst = true;
    for (const FlagName& name : flagNames()) {
        const auto& changes = (report.*name.flag).changes;
        if (changes) {
            if (isFirst) {
                text.family("ternha_transitions_total", "counter",
                            "Changes of a flag since the daemon started.");
                isFirst = false;
            }
            text.sample("ternha_transitions_total{flag=" + quoted(name.name) + '}',
                        static_cast<double>(*changes));
        }
    }
}

[[noreturn]] void failWith(int error, const std::string& path) {
    throw std::system_error(error, std::generic_category(), path);
}

}  // namespace

std::string metrics(const Report& report, const LocalState& local, const Verdict& verdict) {
    Text text;
    addUp(text, true);
    addDaemon(text, report);
    text.gauge("ternha_check_state", "As ternhactl check: 0 OK, 1 warning, 2 critical, 3 unknown.",
               static_cast<double>(verdict.level));
    addPeer(text, report);
    addNode(text, report);
    addLink(text, report, local);
    addDisks(text, report);
    addTransitions(text, report);
    return text.str();
}

std::string metricsOfNoDaemon() {
    Text text;
    addUp(text, false);
    return text.str();
}

void writeAtomically(const std::string& path, const std::string& text) {
    // Collectors read *.prom: the temporary name must not end like that.
    std::string unfinished = path + ".XXXXXX";
    const int fd = mkostemp(unfinished.data(), O_CLOEXEC);
    if (fd < 0) {
        failWith(errno, path);
    }
    fchmod(fd, READABLE);  // independent of the umask
    const ssize_t written = write(fd, text.data(), text.size());
    int error = written < 0 ? errno : 0;
    if (error == 0 && written != static_cast<ssize_t>(text.size())) {
        error = ENOSPC;
    }
    if (close(fd) != 0 && error == 0) {
        error = errno;
    }
    if (error == 0 && std::rename(unfinished.c_str(), path.c_str()) != 0) {
        error = errno;
    }
    if (error != 0) {
        unlink(unfinished.c_str());
        failWith(error, path);
    }
}

}  // namespace ternhactl
