#pragma once

#include <json/json.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <csignal>
#include <string>
#include <vector>

#include "control.h"
#include "support/descriptor.h"
#include "support/files.h"
#include "support/node.h"
#include "support/programs.h"
#include "support/wait.h"

namespace test {

constexpr char CONTROL_SOCKET[] = "/run/ternha/control.sock";

// The arguments of a daemon that looks often.
inline std::vector<std::string> daemonArguments(const std::string& local, const std::string& remote,
                                                const std::string& interface,
                                                const std::vector<std::string>& more = {}) {
    std::vector<std::string> all = {TERNHAD, "--local-ip",           local,     "--remote-ip",
                                    remote,  "--interface",          interface, "--check-interval",
                                    "0.2",   "--heartbeat-interval", "0.5"};
    all.insert(all.end(), more.begin(), more.end());
    return all;
}

// The whole daemon log below `root`: what is on disk, then what is buffered.
inline std::string wholeLog(const std::string& root = "", const std::string& name = "ha.daemon.log") {
    std::string text;
    for (const std::string directory : {"/var/log/ha/", "/tmp/ha/"}) {
        if (exists(root + directory + name)) {
            text += readFile(root + directory + name);
        }
    }
    return text;
}

// A connection to a daemon's control socket.
inline Descriptor connectedClient() {
    Descriptor client(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0), "cannot make a socket");
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::string(CONTROL_SOCKET).copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
    const int result = connect(client.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address);
    check(result == 0, "cannot connect");
    return client;
}

// The status that the daemon with this control socket reports; null when it does not answer.
inline Json::Value statusAt(const std::string& socket = CONTROL_SOCKET) {
    Json::Value status;
    if (exists(socket)) {
        TERN::HA::Daemon::MonitordSocket(socket, 5).getServerData(status);
    }
    return status;
}

}  // namespace test
