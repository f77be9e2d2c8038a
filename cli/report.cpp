#include "report.h"

#include <array>
#include <iomanip>
#include <sstream>
#include <string_view>
#include <utility>

#include "util.h"

namespace ternhactl {

namespace {

constexpr char GREEN[] = "\033[32m";
constexpr char RED[] = "\033[31m";
constexpr char PLAIN[] = "\033[0m";

bool flag(const Json::Value& record, const char* key) {
    const Json::Value& value = record[key];
    return value.isBool() && value.asBool();
}

double number(const Json::Value& record, const char* key) {
    const Json::Value& value = record[key];
    return value.isNumeric() ? value.asDouble() : 0.0;
}

std::vector<std::string> names(const Json::Value& record, const char* key) {
    std::vector<std::string> result;
    for (const Json::Value& element : record[key]) {
        if (element.isString()) {
            result.push_back(element.asString());
        }
    }
    return result;
}

std::string joined(const std::vector<std::string>& items) {
    std::string text;
    for (const std::string& item : items) {
        text += (text.empty() ? "" : ", ") + item;
    }
    return text;
}

// What users call the peer's disks. A disk that the table does not know keeps its device name.
std::vector<std::string> readable(const std::vector<std::string>& devices) {
    std::vector<std::string> result;
    for (const std::string& device : devices) {
        const auto found = TERN::HA::Daemon::Util::devListToHumanReadable({device});
        result.insert(result.end(), found.begin(), found.end());
        if (found.empty()) {
            result.push_back(device);
        }
    }
    return result;
}

std::string fixedPoint(double value, int decimals) {
    std::ostringstream text;
    text << std::fixed << std::setprecision(decimals) << value;
    return text.str();
}

class Table {
 public:
    explicit Table(bool useColour) : _useColour(useColour) {}

    void title(const std::string& text) { _text << text << '\n'; }

    void row(const std::string& label, bool isGood, const std::string& value) {
        _text << "  " << label << std::string(LABEL_WIDTH - label.size(), ' ');
        if (_useColour) {
            _text << (isGood ? GREEN : RED) << value << PLAIN << '\n';
        } else {
            _text << value << '\n';
        }
    }

    void figure(const std::string& label, const std::string& value) {
        _text << "  " << label << std::string(LABEL_WIDTH - label.size(), ' ') << value << '\n';
    }

    std::string text() const { return _text.str(); }

 private:
    static constexpr std::size_t LABEL_WIDTH = 18;

    std::ostringstream _text;
    bool _useColour;
};

std::string diskErrors(bool isHandling, const std::vector<std::string>& disks) {
    if (disks.empty()) {
        return isHandling ? "yes" : "no";
    }
    return (isHandling ? "yes: " : "no: ") + joined(disks);
}

const char* yesNo(bool value) {
    return value ? "yes" : "no";
}

void addMetric(std::ostringstream& text, const char* name, const char* help, double value) {
    text << "# HELP " << name << ' ' << help << "\n# TYPE " << name << " gauge\n"
         << name << ' ' << std::setprecision(9) << value << '\n';
}

// Device names are the kernel's or the peer's word: they must not break the line that quotes them.
std::string labelValue(const std::string& text) {
    std::string escaped;
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
    return escaped;
}

}  // namespace

Report::Report(const Json::Value& record)
    : isPeerAlive(flag(record, "isRemoteAlive")),
      isPeerResync(flag(record, "isRemoteMDResync")),
      isPeerDiskErrHandling(flag(record, "isRemoteDiskErrHandling")),
      peerDisks(names(record, "diskErrorHandlingDiskRemote")),
      isDrbdConnected(flag(record, "isDRBDConnect")),
      isResync(flag(record, "isMDResync")),
      isDiskErrHandling(flag(record, "isDiskErrHandling")),
      disks(names(record, "diskErrorHandlingDisk")),
      latency(number(record, "heartbeatLatency")),
      nonOkRate(number(record, "heartbeatPacketFailRate")) {}

std::string statusTable(const Report& report, bool useColour) {
    Table table(useColour);
    table.title("Peer");
    table.row("state", report.isPeerAlive, report.isPeerAlive ? "alive" : "dead");
    table.row("being rebooted", !report.isPeerRebooting, yesNo(report.isPeerRebooting));
    table.row("RAID resync", !report.isPeerResync, yesNo(report.isPeerResync));
    table.row("disk errors", !report.isPeerDiskErrHandling,
              diskErrors(report.isPeerDiskErrHandling, readable(report.peerDisks)));
    table.title("This node");
    table.row("RAID resync", !report.isResync, yesNo(report.isResync));
    table.row("disk errors", !report.isDiskErrHandling, diskErrors(report.isDiskErrHandling, report.disks));
    table.title("Link");
    table.row("DRBD", report.isDrbdConnected, report.isDrbdConnected ? "connected" : "not connected");
    table.figure("latency", fixedPoint(report.latency, 3) + " ms");
    table.figure("non-OK packets", fixedPoint(report.nonOkRate * 100, 2) + " %");
    return table.text();
}

std::string diskList(const Report& report) {
    std::string text;
    for (const std::string& name : readable(report.peerDisks)) {
        text += "peer: " + name + '\n';
    }
    for (const std::string& name : report.disks) {
        text += "this node: " + name + '\n';
    }
    return text;
}

std::string metrics(const Report& report) {
    std::ostringstream text;
    addMetric(text, "ternha_up", "Whether the daemon answers.", 1);
    addMetric(text, "ternha_peer_alive", "Whether the peer answers.", report.isPeerAlive ? 1 : 0);
    addMetric(text, "ternha_peer_rebooting", "Whether the peer is being rebooted.",
              report.isPeerRebooting ? 1 : 0);
    addMetric(text, "ternha_peer_md_resync", "Whether the peer resynchronises a RAID array.",
              report.isPeerResync ? 1 : 0);
    addMetric(text, "ternha_peer_disk_error_handling", "Whether the peer handles disk errors.",
              report.isPeerDiskErrHandling ? 1 : 0);
    addMetric(text, "ternha_md_resync", "Whether this node resynchronises a RAID array.",
              report.isResync ? 1 : 0);
    addMetric(text, "ternha_disk_error_handling", "Whether this node handles disk errors.",
              report.isDiskErrHandling ? 1 : 0);
    addMetric(text, "ternha_drbd_connected", "Whether the DRBD link is up.", report.isDrbdConnected ? 1 : 0);
    addMetric(text, "ternha_heartbeat_latency_seconds", "Average round trip to the peer, 0 if unknown.",
              report.latency / 1000);
    addMetric(text, "ternha_interface_non_ok_ratio",
              "Share of packets of the replication interface that were not OK.", report.nonOkRate);
    text << "# HELP ternha_disk_error Disks under error handling.\n# TYPE ternha_disk_error gauge\n";
    for (const std::string& device : report.disks) {
        text << R"(ternha_disk_error{node="local",device=")" << labelValue(device) << "\"} 1\n";
    }
    for (const std::string& device : report.peerDisks) {
        text << R"(ternha_disk_error{node="peer",device=")" << labelValue(device) << "\"} 1\n";
    }
    return text.str();
}

Verdict verdict(const Report& report) {
    std::vector<std::string> critical;
    std::vector<std::string> warnings;
    if (!report.isPeerAlive) {
        critical.emplace_back("peer dead");
    }
    if (!report.isDrbdConnected) {
        critical.emplace_back("DRBD not connected");
    }
    const std::array<std::pair<bool, const char*>, 5> unwise = {{
        {report.isPeerRebooting, "peer being rebooted"},
        {report.isPeerResync, "peer resynchronises RAID"},
        {report.isPeerDiskErrHandling, "peer handles disk errors"},
        {report.isResync, "RAID resync"},
        {report.isDiskErrHandling, "disk errors"},
    }};
    for (const auto& [isSo, text] : unwise) {
        if (isSo) {
            warnings.emplace_back(text);
        }
    }

    Verdict result = {Verdict::Level::Ok, "TERNHA OK - peer alive, DRBD connected"};
    if (!critical.empty()) {
        critical.insert(critical.end(), warnings.begin(), warnings.end());
        result = {Verdict::Level::Critical, "TERNHA CRITICAL - " + joined(critical)};
    } else if (!warnings.empty()) {
        result = {Verdict::Level::Warning, "TERNHA WARNING - " + joined(warnings)};
    }
    result.line += " | latency=" + fixedPoint(report.latency, 3) +
                   "ms;;;0 nonok=" + fixedPoint(report.nonOkRate * 100, 4) + "%;;;0;100";
    return result;
}

}  // namespace ternhactl
