#include "verdict.h"

#include <array>
#include <utility>

#include "text.h"

namespace ternhactl {

namespace {

using Reasons = std::vector<std::string>;

void append(Reasons& to, const Reasons& from) {
    to.insert(to.end(), from.begin(), from.end());
}

// What was wrong with a peer that can no longer be asked.
Reasons lastKnown(const Report& report, double now) {
    Reasons found;
    if (report.peerResync.is(true)) {
        found.emplace_back("RAID resync");
    }
    if (report.peerDiskErrors.is(true)) {
        found.emplace_back("disk errors");
    }
    if (found.empty()) {
        return {};
    }
    const std::string age = report.lastReply ? ' ' + duration(now - *report.lastReply) + " ago" : "";
    return {"peer's last known state" + age + ": " + joined(found)};
}

// One figure of the performance data.
std::string figure(const char* name, const std::string& value, const char* limits) {
    return std::string(name) + '=' + value + limits;
}

}  // namespace

const char* Verdict::word() const {
    static constexpr std::array<const char*, 4> WORDS = {"OK", "WARNING", "CRITICAL", "UNKNOWN"};
    return WORDS.at(static_cast<std::size_t>(level));
}

Verdict verdict(const Report& report, const LocalState& local) {
    const double now = report.time.value_or(currentTime());
    Reasons critical;
    Reasons unknown;
    Reasons warnings;
    if (report.peerAlive.is(false)) {
        critical.push_back("peer dead" + sinceOf(report.peerAlive.since, now));
    } else if (!report.peerAlive.value) {
        unknown.emplace_back("peer not probed yet");
    }
    if (!local.unsupportedDrbd.empty()) {
        critical.push_back("DRBD " + local.unsupportedDrbd + " is not supported, 8.4 is");
    } else if (report.connected.is(false)) {
        critical.push_back("DRBD not connected" + std::string(local.hasDrbd ? "" : " (no /proc/drbd)"));
    } else {
        if (!report.connected.value) {
            unknown.emplace_back("DRBD not checked yet");
        }
        append(warnings, local.unlinked);
    }
    if (report.peerAlive.is(true) && (!report.peerResync.value || !report.peerDiskErrors.value)) {
        unknown.emplace_back("peer's RAID and disks not known yet");
    }
    if (!report.resync.value || !report.diskErrors.value) {
        unknown.emplace_back("this node not checked yet");
    }
    const std::array<std::pair<bool, const char*>, 5> unwise = {{
        {report.peerRebooting.is(true), "peer being rebooted"},
        {report.peerResync.is(true) && !report.isStale(), "peer resynchronises RAID"},
        {report.peerDiskErrors.is(true) && !report.isStale(), "peer handles disk errors"},
        {report.resync.is(true), "RAID resync"},
        {report.diskErrors.is(true), "disk errors"},
    }};
    for (const auto& [isSo, text] : unwise) {
        if (isSo) {
            warnings.emplace_back(text);
        }
    }
    append(warnings, local.replicaProblems);
    append(warnings, local.peerReplicaProblems);
    append(warnings, local.arrayProblems);
    if (report.isStale()) {
        append(warnings, lastKnown(report, now));
    }

    Verdict result;
    if (!critical.empty()) {
        result.level = Verdict::Level::Critical;
    } else if (!unknown.empty()) {
        result.level = Verdict::Level::Unknown;
    } else if (!warnings.empty()) {
        result.level = Verdict::Level::Warning;
    } else {
        result.reasons = {"peer alive" + sinceOf(report.peerAlive.since, now), "DRBD connected"};
    }
    append(result.reasons, critical);
    append(result.reasons, unknown);
    append(result.reasons, warnings);
    return result;
}

Verdict verdictOfNode(const Report& report, const LocalState& local) {
    Verdict result;
    if (report.resync.is(true)) {
        result.reasons.emplace_back("RAID resync");
    }
    if (report.diskErrors.is(true)) {
        result.reasons.emplace_back("disk errors");
    }
    append(result.reasons, local.replicaProblems);
    append(result.reasons, local.arrayProblems);
    if (!result.reasons.empty()) {
        result.level = Verdict::Level::Warning;
    } else if (!report.resync.value || !report.diskErrors.value) {
        result.level = Verdict::Level::Unknown;
        result.reasons = {"this node not checked yet"};
    } else if (!local.hasDrbd || !local.unsupportedDrbd.empty()) {
        result.level = Verdict::Level::Unknown;
        result.reasons = {local.hasDrbd
                              ? "replica unknown: DRBD " + local.unsupportedDrbd + " is not supported, 8.4 is"
                              : "replica unknown: no /proc/drbd"};
    } else {
        result.reasons = {"this node could serve alone"};
    }
    return result;
}

std::string pluginLine(const Verdict& verdict) {
    return "TERNHA " + std::string(verdict.word()) + " - " + joined(verdict.reasons);
}

std::string pluginLine(const Report& report, const Verdict& verdict) {
    const bool isLatencyKnown = report.latency.value && !report.isStale();
    return pluginLine(verdict) + " | " +
           figure("latency", isLatencyKnown ? fixedPoint(*report.latency.value, 3) + "ms" : "U", ";;;0 ") +
           figure("nonok", report.nonOkRate.value ? fixedPoint(*report.nonOkRate.value * 100, 4) + '%' : "U",
                  ";;;0;100");
}

}  // namespace ternhactl
