#include "control.h"

#include <utility>

#include "checker.h"
#include "ha_log.h"
#include "json_text.h"

namespace TERN::HA::Daemon {

namespace {

constexpr char ACTION[] = "act";
constexpr char IS_REBOOTING[] = "is_froce_reboot_remote";

Json::Value requestFor(const char* action) {
    Json::Value request(Json::objectValue);
    request[ACTION] = action;
    return request;
}

}  // namespace

MonitordSocket::MonitordSocket(std::string path, unsigned int timeout)
    : DaemonLocalSocket(std::move(path), timeout), _status(nullptr) {}

void MonitordSocket::setStatus(Status* status) {
    _status = status;
}

bool MonitordSocket::serverHandle(const Json::Value& request, Json::Value& reply) {
    if (!request.isObject() || !request.isMember(ACTION)) {
        HA_LOG("Failed get action from content: " + jsonText(request));
        return false;
    }
    std::string action;
    readString(request[ACTION], action);
    switch (action.c_str()[0]) {
        case 'R':
            if (!RebootRemote()(*_status)) {
                HA_LOG("Failed to reboot remote");
                return false;
            }
            return true;
        case 'r':
            reply[IS_REBOOTING] = _status->isRemoteRebooting();
            return true;
        case 'I':
            reply = _status->toJson();
            return true;
        default:
            HA_LOG("Unknown action " + action);
            return false;
    }
}

bool MonitordSocket::getServerData(Json::Value& out) {
    return clientSend(requestFor("I"), out);
}

bool MonitordSocket::rebootRemote() {
    Json::Value reply;
    return clientSend(requestFor("R"), reply);
}

bool MonitordSocket::isRebootRemote() {
    Json::Value reply;
    bool rebooting = false;
    if (clientSend(requestFor("r"), reply) && reply.isObject()) {
        readBool(reply[IS_REBOOTING], rebooting);
    }
    return rebooting;
}

}  // namespace TERN::HA::Daemon
