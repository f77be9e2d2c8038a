/// @file
/// The control socket of the daemon.

#pragma once

#include <json/value.h>

#include <string>

#include "socket.h"
#include "status.h"

#pragma GCC visibility push(default)

namespace TERN::HA::Daemon {

/// The daemon's control socket: local tools read its status or order a reboot of the peer.
///
/// A request is an object whose "act" is a string; its first character decides:
///   "I"  the reply is Status::toJson()
///   "r"  the reply's "is_froce_reboot_remote" tells whether the peer is being rebooted
///   "R"  reboots the peer; the reply is null and comes after up to 33 seconds, in which nobody else is
///   served
/// Anything else is not answered and leaves a line in the daemon log: "Unknown action " or "Failed get action
/// from content: ".
///
/// As a client make a fresh object for each call. One thread at a time.
class MonitordSocket : public DaemonLocalSocket {
 public:
    /// `path` and `timeout` (seconds) as for DaemonLocalSocket.
    MonitordSocket(std::string path, unsigned int timeout);

    /// Server: the record to answer from, not owned. Set it before the first request is served.
    void setStatus(Status* status);

    /// Server: answers one request as described above; false when it is refused.
    bool serverHandle(const Json::Value& request, Json::Value& reply) override;

    /// Client: the daemon's status into `out`; false when there is no answer.
    bool getServerData(Json::Value& out);

    /// Client: orders the peer's reboot; true once the daemon has followed it down. Give the object a
    /// time-out above 33 seconds.
    bool rebootRemote();

    /// Client: true when the daemon answers that the peer is being rebooted.
    bool isRebootRemote();

 private:
    Status* _status;
};

}  // namespace TERN::HA::Daemon

#pragma GCC visibility pop
