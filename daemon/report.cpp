#include "report.h"

#include <unistd.h>

#include <array>
#include <climits>

#include "printable.h"

namespace ternhad {

namespace {

constexpr auto MEASUREMENT = std::chrono::seconds(10);  // longest duration of a ping

Json::Value toJson(Findings::OrderOutcome outcome) {
    switch (outcome) {
        case Findings::OrderOutcome::wentDown:
            return "went-down";
        case Findings::OrderOutcome::stillAnswers:
            return "still-answers";
        case Findings::OrderOutcome::wasDead:
            return "was-dead";
        case Findings::OrderOutcome::wasUnknown:
            return "was-unknown";
        case Findings::OrderOutcome::none:
            break;
    }
    return {};
}

Json::Value textOrNull(const std::string& text) {
    return text.empty() ? Json::Value() : Json::Value(text);
}

// Return the name that is sent to the peer, or else that of the machine.
std::string nodeName(const Health& health) {
    std::string name = printable(health.hostname());
    if (name.empty()) {
        std::array<char, HOST_NAME_MAX + 1> buffer = {};
        gethostname(buffer.data(), buffer.size() - 1);
        name = buffer.data();
    }
    return name;
}

}  // namespace

Json::Value Reporter::figure(const Findings::Figure& figure) const {
    Json::Value json(Json::objectValue);
    json["value"] = figure.value ? Json::Value(*figure.value) : Json::Value();
    json["time"] = figure.value ? Json::Value(secondsOf(figure.time)) : Json::Value();
    const bool isOld = Clock::now() - figure.measured > 3 * _options.heartbeatInterval + MEASUREMENT;
    json["stale"] = figure.value && (figure.isStale || isOld);
    return json;
}

Json::Value Reporter::flag(Flag flag) const {
    const Transitions::State state = _health.transitions().state(flag);
    Json::Value json(Json::objectValue);
    json["value"] = state.value ? Json::Value(*state.value) : Json::Value();
    json["since"] = state.value ? Json::Value(secondsOf(state.since)) : Json::Value();
    json["changes"] = Json::UInt64{state.changes};
    json["checked"] = state.value ? Json::Value(secondsOf(state.checked)) : Json::Value();
    json["stale"] = state.isStale;
    return json;
}

Json::Value Reporter::report() const {
    const Findings& findings = _health.findings();
    _health.updatePeerRebooting();
    Json::Value report(Json::objectValue);
    report["version"] = 1;
    report["time"] = secondsOf(wallClock());
    report["daemon"]["version"] = TERNHA_VERSION;
    report["daemon"]["started"] = _started;

    Json::Value& node = report["node"];
    node["name"] = textOrNull(nodeName(_health));
    node["address"] = _options.localIp;
    node["resync"] = flag(Flag::resync);
    node["diskErrors"] = flag(Flag::diskErrors);
    node["disks"] = _health.status().getErrHandlingDisk();

    Json::Value& peer = report["peer"];
    peer["name"] = textOrNull(findings.peerName());
    peer["address"] = _options.remoteIp;
    peer["lastReply"] = findings.lastReply() > 0 ? Json::Value(findings.lastReply()) : Json::Value();
    peer["alive"] = flag(Flag::peerAlive);
    peer["rebooting"] = flag(Flag::peerRebooting);
    peer["resync"] = flag(Flag::peerResync);
    peer["diskErrors"] = flag(Flag::peerDiskErrors);
    peer["orderOutcome"] = toJson(findings.orderOutcome());
    peer["disks"] =
        findings.arePeerDisksKnown() ? _health.status().getErrHandlingDiskRemote() : Json::Value();

    Json::Value& link = report["link"];
    link["interface"] = _options.interface;
    link["connected"] = flag(Flag::drbdConnected);
    link["latency"] = figure(findings.latency());
    if (findings.latency().value && !_health.isPeerAlive()) {
        link["latency"]["stale"] = true;
    }
    link["nonOkRate"] = figure(findings.nonOkRate());

    report["record"] = _health.status().toJson();
    return report;
}

Json::Value Reporter::event(const Transition& transition) {
    Json::Value json(Json::objectValue);
    json["event"] = nameOf(transition.flag).name;
    json["old"] = conditionOf(transition.flag, transition.old);
    json["new"] = conditionOf(transition.flag, transition.value);
    json["time"] = secondsOf(transition.time);
    return json;
}

Json::Value Reporter::lostEvents(std::uint64_t count) {
    Json::Value json(Json::objectValue);
    json["event"] = "lost";
    json["count"] = Json::UInt64{count};
    json["time"] = secondsOf(wallClock());
    return json;
}

}  // namespace ternhad
