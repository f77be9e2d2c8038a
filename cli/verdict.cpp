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

// Last known problems of a peer that is no longer alive.
Reasons lastKnownTrouble(const Report& report, double now) {
    Reasons found;
    if (report.peerResync.isStale && report.peerResync.value == true) {
        found.emplace_back("RAID resync");
    }
    if (report.peerDiskErrors.isStale && report.peerDiskErrors.value == true) {
        found.emplace_back("disk errors");
    }
    if (found.empty()) {
        return {};
    }
    const std::string age = report.lastReply ? ' ' + duration(now - *report.lastReply) + " ago" : "";
    return {"peer's last known state" + age + ": " + joined(found)};
}

// A flag without a recent check: "not known yet", or the age of its last known value.
std::string unknownState(const Report::Flag& flag, const char* verb, double now) {
    return flag.value ? lastKnown(flag.checked, now) : std::string("not ") + verb + " yet";
}

// Return the older of two flags that must both be known; null if they are.
const Report::Flag* unknownOf(const Report::Flag& a, const Report::Flag& b) {
    if (!a.isKnown()) {
        return &a;
    }
    return b.isKnown() ? nullptr : &b;
}

// Format one value of the performance data.
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
        unknown.emplace_back("peer has not replied yet");
    }
    if (!local.unsupportedDrbd.empty()) {
        critical.push_back("DRBD " + local.unsupportedDrbd + " is not supported, 8.4 is");
    } else if (report.connected.is(false)) {
        const std::string missing = local.missingDrbd();
        critical.push_back("DRBD not connected" + (missing.empty() ? "" : " (" + missing + ")"));
    } else {
        if (!report.connected.isKnown()) {
            unknown.push_back("DRBD " + unknownState(report.connected, "checked", now));
        }
        append(warnings, local.unlinked);
    }
    if (const auto* flag = unknownOf(report.peerResync, report.peerDiskErrors);
        flag != nullptr && report.peerAlive.is(true)) {
        unknown.push_back("peer's RAID and disks " + unknownState(*flag, "known", now));
    }
    if (const auto* flag = unknownOf(report.resync, report.diskErrors)) {
        unknown.push_back("this node " + unknownState(*flag, "checked", now));
    }
    std::string disks = "peer handles disk errors";
    if (report.hasTooManyPeerDisks()) {
        disks += std::string(" (") + TOO_MANY_DISKS + ')';
    }
    const std::array<std::pair<bool, const char*>, 5> unwise = {{
        {report.peerRebooting.is(true), "peer being rebooted"},
        {report.peerResync.is(true), "peer resynchronises RAID"},
        {report.peerDiskErrors.is(true), disks.c_str()},
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
    append(warnings, lastKnownTrouble(report, now));

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
    const double now = report.time.value_or(currentTime());
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
    } else if (const auto* flag = unknownOf(report.resync, report.diskErrors)) {
        result.level = Verdict::Level::Unknown;
        result.reasons = {"this node " + unknownState(*flag, "checked", now)};
    } else if (!local.unsupportedDrbd.empty()) {
        result.level = Verdict::Level::Unknown;
        result.reasons = {"replica unknown: DRBD " + local.unsupportedDrbd + " is not supported, 8.4 is"};
    } else if (const std::string missing = local.missingDrbd(); !missing.empty()) {
        result.level = Verdict::Level::Unknown;
        result.reasons = {"replica unknown: DRBD has " + missing};
    } else {
        result.reasons = {"this node could serve alone"};
    }
    return result;
}

std::string pluginLine(const Verdict& verdict) {
    return "TERNHA " + std::string(verdict.word()) + " - " + joined(verdict.reasons);
}

std::string pluginLine(const Report& report, const Verdict& verdict) {
    const auto latency = report.latency.current();
    const auto rate = report.nonOkRate.current();
    return pluginLine(verdict) + " | " +
           figure("latency", latency ? fixedPoint(*latency, 3) + "ms" : "U", ";;;0 ") +
           figure("nonok", rate ? fixedPoint(*rate * 100, 4) + '%' : "U", ";;;0;100");
}

}  // namespace ternhactl
