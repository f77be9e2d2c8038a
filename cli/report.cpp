#include "report.h"

#include "client.h"

namespace ternhactl {

namespace {

// jsoncpp throws if a member of something other than an object is requested.
const Json::Value& member(const Json::Value& object, const char* key) {
    return object.isObject() ? object[key] : Json::Value::nullSingleton();
}

std::optional<double> number(const Json::Value& value) {
    return value.isNumeric() ? std::optional(value.asDouble()) : std::nullopt;
}

std::string text(const Json::Value& value) {
    return value.isString() ? value.asString() : std::string();
}

std::optional<std::vector<std::string>> names(const Json::Value& value) {
    if (!value.isArray()) {
        return std::nullopt;
    }
    std::vector<std::string> result;
    for (const Json::Value& element : value) {
        if (element.isString()) {
            result.push_back(element.asString());
        }
    }
    return result;
}

// Older daemons do not report it.
bool isStale(const Json::Value& json, bool otherwise) {
    const Json::Value& value = member(json, "stale");
    return value.isBool() ? value.asBool() : otherwise;
}

Report::Flag flag(const Json::Value& json) {
    const Json::Value& value = member(json, "value");
    const Json::Value& changes = member(json, "changes");
    return {value.isBool() ? std::optional(value.asBool()) : std::nullopt, number(member(json, "since")),
            changes.isUInt64() ? std::optional<std::uint64_t>(changes.asUInt64()) : std::nullopt,
            number(member(json, "checked")), isStale(json, false)};
}

// Values that come from the peer or need it are stale while it is not alive.
Report::Flag peerFlag(const Json::Value& json, const Report& report) {
    Report::Flag result = flag(json);
    result.isStale = isStale(json, !report.peerAlive.is(true));
    if (!result.checked) {
        result.checked = report.lastReply;
    }
    return result;
}

Report::Figure figure(const Json::Value& json, bool isStaleOtherwise) {
    return {number(member(json, "value")), number(member(json, "time")), isStale(json, isStaleOtherwise)};
}

// Display name of a node: its hostname, or else its address.
std::string label(const Json::Value& node, const char* otherwise) {
    for (const char* key : {"name", "address"}) {
        std::string found = text(member(node, key));
        if (!found.empty()) {
            return found;
        }
    }
    return otherwise;
}

Json::Value valueOnly(const Json::Value& value) {
    Json::Value json(Json::objectValue);
    json["value"] = value;
    return json;
}

// Older daemons know neither names nor times; an unknown latency is 0 there.
Json::Value reportOf(const Json::Value& record, bool isRebooting) {
    Json::Value report(Json::objectValue);
    report["version"] = 1;
    report["record"] = record;
    Json::Value& peer = report["peer"];
    peer["alive"] = valueOnly(record["isRemoteAlive"]);
    peer["rebooting"] = valueOnly(isRebooting);
    peer["resync"] = valueOnly(record["isRemoteMDResync"]);
    peer["diskErrors"] = valueOnly(record["isRemoteDiskErrHandling"]);
    peer["disks"] = record["diskErrorHandlingDiskRemote"];
    Json::Value& node = report["node"];
    node["resync"] = valueOnly(record["isMDResync"]);
    node["diskErrors"] = valueOnly(record["isDiskErrHandling"]);
    node["disks"] = record["diskErrorHandlingDisk"];
    Json::Value& link = report["link"];
    link["connected"] = valueOnly(record["isDRBDConnect"]);
    const double latency = number(record["heartbeatLatency"]).value_or(0);
    const double rate = number(record["heartbeatPacketFailRate"]).value_or(-1);
    link["latency"] = valueOnly(latency > 0 ? Json::Value(latency) : Json::Value());
    link["nonOkRate"] = valueOnly(rate >= 0 && rate <= 1 ? Json::Value(rate) : Json::Value());
    return report;
}

}  // namespace

Report::Report(const Json::Value& json)
    : time(number(member(json, "time"))),
      version(text(member(member(json, "daemon"), "version"))),
      started(number(member(member(json, "daemon"), "started"))),
      node(label(member(json, "node"), "this node")),
      peer(label(member(json, "peer"), "peer")),
      lastReply(number(member(member(json, "peer"), "lastReply"))),
      peerAlive(flag(member(member(json, "peer"), "alive"))),
      peerRebooting(flag(member(member(json, "peer"), "rebooting"))),
      orderOutcome(text(member(member(json, "peer"), "orderOutcome"))),
      peerResync(peerFlag(member(member(json, "peer"), "resync"), *this)),
      peerDiskErrors(peerFlag(member(member(json, "peer"), "diskErrors"), *this)),
      peerDisks(names(member(member(json, "peer"), "disks"))),
      connected(flag(member(member(json, "link"), "connected"))),
      resync(flag(member(member(json, "node"), "resync"))),
      diskErrors(flag(member(member(json, "node"), "diskErrors"))),
      disks(names(member(member(json, "node"), "disks")).value_or(std::vector<std::string>())),
      latency(figure(member(member(json, "link"), "latency"), !peerAlive.is(true))),
      nonOkRate(figure(member(member(json, "link"), "nonOkRate"), false)) {}

const std::vector<FlagName>& flagNames() {
    static const std::vector<FlagName> names = {
        {"peer", "peer-alive", "peer-dead", &Report::peerAlive},
        {"peer-reboot", "peer-rebooting", "peer-not-rebooting", &Report::peerRebooting},
        {"peer-resync", "peer-resync", "peer-no-resync", &Report::peerResync},
        {"peer-disk-errors", "peer-disk-errors", "peer-no-disk-errors", &Report::peerDiskErrors},
        {"drbd", "connected", "not-connected", &Report::connected},
        {"resync", "resync", "no-resync", &Report::resync},
        {"disk-errors", "disk-errors", "no-disk-errors", &Report::diskErrors},
    };
    return names;
}

namespace {

Json::Value fetchRecord(const Settings& settings, const Deadline& deadline) {
    Json::Value record = ask(settings, "I", deadline);
    if (!record.isObject()) {
        throw NoAnswer("the reply is not ternhad's");
    }
    return record;
}

}  // namespace

Json::Value fetchRecord(const Settings& settings) {
    return fetchRecord(settings, Deadline(settings.timeout));
}

Json::Value fetchReport(const Settings& settings) {
    const Deadline deadline(settings.timeout);
    try {
        Json::Value report = ask(settings, "S", deadline);
        if (!report.isObject()) {
            throw NoAnswer("the reply is not ternhad's");
        }
        return report;
    } catch (const Refused&) {
        const Json::Value record = fetchRecord(settings, deadline);
        const Json::Value rebooting = ask(settings, "r", deadline);
        const Json::Value& value = member(rebooting, "is_froce_reboot_remote");
        return reportOf(record, value.isBool() && value.asBool());
    }
}

}  // namespace ternhactl
