#include "status_view.h"

#include <algorithm>
#include <array>
#include <sstream>

#include "text.h"
#include "util.h"
#include "verdict.h"

namespace ternhactl {

namespace {

constexpr char RED[] = "\033[31m";
constexpr char DIM[] = "\033[2m";
constexpr char PLAIN[] = "\033[0m";

enum class Look { Normal, Trouble, Stale };

class View {
 public:
    explicit View(bool useColour) : _useColour(useColour) {}

    void line(const std::string& text) { _text << text << '\n'; }

    void row(const std::string& label, Look look, const std::string& value) {
        _text << "  " << label << std::string(LABEL_WIDTH - label.size(), ' ') << painted(look, value)
              << '\n';
    }

    std::string painted(Look look, const std::string& text) const {
        return _useColour && look != Look::Normal ? (look == Look::Trouble ? RED : DIM) + text + PLAIN : text;
    }

    std::string text() const { return _text.str(); }

 private:
    static constexpr std::size_t LABEL_WIDTH = 18;

    std::ostringstream _text;
    bool _useColour;
};

Look troubleIf(bool isTrouble) {
    return isTrouble ? Look::Trouble : Look::Normal;
}

// Human-readable names of the peer's disks; device names for those not in the table.
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

std::string yesNo(const Report::Flag& flag, double now) {
    if (!flag.value) {
        return "unknown";
    }
    return *flag.value ? "yes" + sinceOf(flag.since, now) : "no";
}

std::string headline(const Report& report, const LocalState& local, double now) {
    const Verdict result = verdict(report, local);
    const bool isOk = result.level == Verdict::Level::Ok;
    return report.node + " <-> " + report.peer + ": " + result.word() + ", " +
           (isOk ? "alive" + sinceOf(report.peerAlive.since, now) : joined(result.reasons));
}

void addFlag(View& view, const char* label, const Report::Flag& flag, const std::string& value, double now,
             bool isTroubleSet = true) {
    const bool isOld = flag.value && flag.isStale;
    view.row(label, isOld ? Look::Stale : troubleIf(flag.is(isTroubleSet)),
             value + (isOld ? " (" + lastKnown(flag.checked, now) + ')' : ""));
}

void addFigure(View& view, const char* label, const Report::Figure& figure, double factor, int decimals,
               const char* unit, double now) {
    const bool isOld = figure.value && figure.isStale;
    const std::string value = figure.value ? fixedPoint(*figure.value * factor, decimals) + unit : "unknown";
    view.row(label, isOld ? Look::Stale : Look::Normal,
             value + (isOld ? " (" + lastKnown(figure.time, now) + ')' : ""));
}

void addPeer(View& view, const Report& report, double now) {
    view.line("Peer");
    if (!report.peerAlive.value) {
        view.row("state", Look::Normal, "unknown");
    } else {
        std::string state =
            (report.peerAlive.is(true) ? "alive" : "dead") + sinceOf(report.peerAlive.since, now);
        if (report.lastReply && (report.peerAlive.is(false) || report.peerResync.isStale)) {
            state += ", last reply " + duration(now - *report.lastReply) + " ago";
        }
        view.row("state", troubleIf(report.peerAlive.is(false)), state);
    }
    view.row("being rebooted", troubleIf(report.peerRebooting.is(true)), yesNo(report.peerRebooting, now));

    addFlag(view, "RAID resync", report.peerResync, yesNo(report.peerResync, now), now);
    std::string disks = yesNo(report.peerDiskErrors, now);
    if (report.hasTooManyPeerDisks()) {
        disks += std::string(", ") + TOO_MANY_DISKS;
    } else if (report.peerDisks && !report.peerDisks->empty()) {
        disks += ": " + joined(readable(*report.peerDisks));
    }
    addFlag(view, "disk errors", report.peerDiskErrors, disks, now);
}

void addNode(View& view, const Report& report, const LocalState& local, double now) {
    view.line("This node");
    addFlag(view, "RAID resync", report.resync,
            local.hasArrays || !report.resync.is(false) ? yesNo(report.resync, now) : "no arrays", now);
    if (!local.arrayProblems.empty()) {
        view.row("RAID arrays", Look::Trouble, joined(local.arrayProblems));
    }
    std::string disks = yesNo(report.diskErrors, now);
    if (!local.isErrorHandlingKnown && report.diskErrors.is(false)) {
        disks = local.hasAtaPorts ? "unknown (the ATA ports do not tell)" : "no ATA ports";
    } else if (!report.disks.empty()) {
        disks += ": " + joined(report.disks);
    }
    addFlag(view, "disk errors", report.diskErrors, disks, now);
}

std::string drbdState(const Report::Flag& connected, const LocalState& local, double now) {
    if (!connected.value) {
        return "unknown";
    }
    if (*connected.value) {
        return "connected" + sinceOf(connected.since, now);
    }
    const std::string missing = local.missingDrbd();
    return "not connected" + (missing.empty() ? sinceOf(connected.since, now) : " (" + missing + ")");
}

void addDrbd(View& view, const Report& report, const LocalState& local, double now) {
    if (!local.unsupportedDrbd.empty()) {
        view.row("DRBD", Look::Trouble, local.unsupportedDrbd + " is not supported, 8.4 is");
    } else {
        addFlag(view, "DRBD", report.connected, drbdState(report.connected, local, now), now, false);
    }
    const std::vector<std::string> none;
    for (const auto* problems : {report.connected.is(true) ? &local.unlinked : &none, &local.replicaProblems,
                                 &local.peerReplicaProblems}) {
        for (const std::string& problem : *problems) {
            view.row("", Look::Trouble, problem);
        }
    }
}

void addLink(View& view, const Report& report, const LocalState& local, double now) {
    view.line("Link");
    addDrbd(view, report, local, now);
    addFigure(view, "latency", report.latency, 1, 3, " ms", now);
    addFigure(view, "non-OK packets", report.nonOkRate, 100, 2, " %", now);
}

// Print a line for each name, and none if it is certain that there are no disks.
std::string disksOf(const std::string& owner, const Report::Flag& flag, std::vector<std::string> names,
                    double now) {
    if (!flag.value) {
        names = {"unknown"};
    } else if (flag.isStale && names.empty()) {
        names = {"none"};
    }
    const std::string begin =
        owner + (flag.value && flag.isStale ? ", " + lastKnown(flag.checked, now) : "") + ": ";
    std::string text;
    for (const std::string& name : names) {
        text += begin;
        text += name + '\n';
    }
    return text;
}

}  // namespace

std::string statusView(const Report& report, const LocalState& local, bool useColour) {
    const double now = report.time.value_or(currentTime());
    View view(useColour);
    view.line(view.painted(troubleIf(verdict(report, local).level != Verdict::Level::Ok),
                           headline(report, local, now)));
    addPeer(view, report, now);
    addNode(view, report, local, now);
    addLink(view, report, local, now);
    return view.text();
}

std::string dimmed(const std::string& text, bool useColour) {
    return View(useColour).painted(Look::Stale, text);
}

std::string diskList(const Report& report) {
    const double now = report.time.value_or(currentTime());
    std::vector<std::string> peerDisks = readable(report.peerDisks.value_or(std::vector<std::string>()));
    if (report.hasTooManyPeerDisks()) {
        peerDisks = {TOO_MANY_DISKS};
    }
    return disksOf("peer", report.peerDiskErrors, peerDisks, now) +
           disksOf("this node", report.diskErrors, report.disks, now);
}

std::string blocks(const std::vector<std::optional<double>>& values) {
    static constexpr std::array<const char*, 8> HEIGHTS = {"▁", "▂", "▃", "▄", "▅", "▆", "▇", "█"};
    double largest = 0;
    for (const auto& value : values) {
        largest = std::max(largest, value.value_or(0));
    }
    std::string text;
    for (const auto& value : values) {
        if (value) {
            const double share = largest > 0 ? *value / largest : 0;
            text += HEIGHTS.at(static_cast<std::size_t>(share * (HEIGHTS.size() - 1)));
        } else {
            text += "·";
        }
    }
    return text;
}

}  // namespace ternhactl
