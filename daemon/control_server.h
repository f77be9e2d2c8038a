#pragma once

#include <string>

#include "control.h"

namespace ternhad {

// The serving end of the control socket. The library serves one client after another and waits for each
// without bound; here a client that sends nothing for 5 seconds loses its connection.
class ControlServer final : public TERN::HA::Daemon::MonitordSocket {
 public:
    explicit ControlServer(const std::string& path);
    ~ControlServer();

    ControlServer(const ControlServer&) = delete;
    ControlServer& operator=(const ControlServer&) = delete;

    // Replaces the socket file and listens. False, with errno, when that fails.
    bool listen();

    // Serves one client. Returns early when a signal comes.
    void serve();

 private:
    std::string _path;
    int _listener = -1;
};

}  // namespace ternhad
