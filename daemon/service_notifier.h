#pragma once

#include <chrono>
#include <optional>
#include <string>

// Tells the service manager that started the daemon what state it is in. Without one, or in a build without
// libsystemd, nothing happens. Each function may be called from any thread, and does not block but for a
// datagram to a local socket.
namespace ternhad {

// The peer and the control tool are served from now on.
void notifyReady();

// The daemon is ending on purpose.
void notifyStopping();

// One line for people: what `systemctl status` shows.
void notifyStatus(const std::string& status);

// How often at least notifyAlive() is expected; nothing when nobody watches. Half of it is a good period.
std::optional<std::chrono::microseconds> watchdogInterval();

// The daemon's threads make progress. A daemon that leaves this out for longer than the interval is ended
// with SIGABRT and started again.
void notifyAlive();

}  // namespace ternhad
