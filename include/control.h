/// @file
/// Control socket of the daemon: its requests, and the client that sends them.

#pragma once

#include <json/value.h>

#include <string>

#include "socket.h"
#include "status.h"

#pragma GCC visibility push(default)

namespace TERN::HA::Daemon {

/// The control socket, through which local tools read the daemon's status or request a reboot of
/// the peer.
///
/// A request is a JSON object whose member "act" is a string. Its first character selects the
/// action, the rest is ignored:
///
///   "I"  reply with Status::toJson()
///   "r"  reply with an object whose "is_froce_reboot_remote" (bool) is Status::isRemoteRebooting()
///   "R"  reboot the peer (RebootRemote); the reply is null and takes up to 33 seconds, during
///        which no other request is served
///
/// Any other action gets no reply and logs "Unknown action " and the value of "act"; a request
/// without "act" logs "Failed get action from content: " and the request.
///
/// Not thread-safe: use an object from one thread at a time. As a client, construct an object per
/// call. No operation throws.
class MonitordSocket : public DaemonLocalSocket {
 public:
    /// Construct as DaemonLocalSocket does: `path` of the socket file, `timeout` of a client in
    /// seconds.
    MonitordSocket(std::string path, unsigned int timeout);

    /// Server: set the record used for replies. Not owned; must be set before the first
    /// request is served.
    void setStatus(Status* status);

    /// Server: carry out `request` as described above and store its reply in `reply`. Returns true
    /// when the reply is to be sent, false when the request was refused. Blocks for up to 33
    /// seconds in "R", and for the locks of the status otherwise.
    bool serverHandle(const Json::Value& request, Json::Value& reply) override;

    /// Client: store the daemon's status (see Status::toJson) in `out`. Returns false, with `out`
    /// unchanged, when no reply arrived. Blocks as clientSend does.
    bool getServerData(Json::Value& out);

    /// Client: request a reboot of the peer. Returns true once the daemon has sent its reply, false
    /// when none arrived. Construct the object with a timeout above 33 seconds.
    bool rebootRemote();

    /// Client: return true when the daemon replied that the peer is being rebooted, false
    /// otherwise. Blocks as clientSend does.
    bool isRebootRemote();

 private:
    Status* _status;
};

}  // namespace TERN::HA::Daemon

#pragma GCC visibility pop
