#include "control.h"

#include <new>
#include <utility>

#include "checker.h"
#include "ha_log.h"
#include "json_text.h"

namespace TERN::HA::Daemon {

namespace {

constexpr char ACTION[] = "act";
constexpr char IS_REBOOTING[] = "is_froce_reboot_remote";

// Send a request to the daemon; return false when no reply arrives.
bool exchange(DaemonLocalSocket& client, const char* action, Json::Value& reply) try {
    Json::Value request(Json::objectValue);
    request[ACTION] = action;
    return client.clientSend(request, reply);
} catch (const std::bad_alloc&) {
    return false;
} catch (const JsonOutOfMemory&) {
    return false;
}

}  // namespace

MonitordSocket::MonitordSocket(std::string path, unsigned int timeout)
    : DaemonLocalSocket(std::move(path), timeout), _status(nullptr) {}

void MonitordSocket::setStatus(Status* status) {
    _status = status;
}

bool MonitordSocket::serverHandle(const Json::Value& request, Json::Value& reply) try {
    if (!request.isObject() || !request.isMember(ACTION)) {
        HA_LOG("Failed get action from content: " + jsonText(request));
        return false;
    }
    const std::string action = readString(request[ACTION]).value_or("");
    // Frozen: docs/compatibility.md#first-character
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
} catch (const std::bad_alloc&) {
    return false;
} catch (const JsonOutOfMemory&) {
    return false;
}

bool MonitordSocket::getServerData(Json::Value& out) {
    return exchange(*this, "I", out);
}

bool MonitordSocket::rebootRemote() {
    Json::Value reply;
    return exchange(*this, "R", reply);
}

bool MonitordSocket::isRebootRemote() {
    Json::Value reply;
    return exchange(*this, "r", reply) && reply.isObject() &&
           readBool(std::as_const(reply)[IS_REBOOTING])
               .value_or(false);  // adds no member, which takes memory
}

}  // namespace TERN::HA::Daemon
