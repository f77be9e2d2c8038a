#pragma once

#include <chrono>
#include <optional>
#include <string>

// Notifications to the service manager (systemd). Without one, or in a build without libsystemd,
// they do nothing. Callable from any thread; they block only for a datagram to a local socket.
namespace ternhad {

// Report readiness: peer and clients are served.
void notifyReady();

// Report the stop of the daemon.
void notifyStopping();

// Set the status line that `systemctl status` shows.
void notifyStatus(const std::string& status);

// Return the watchdog's interval, or nothing without a watchdog. Call notifyAlive() at half of it.
std::optional<std::chrono::microseconds> watchdogInterval();

// Reset the watchdog, which otherwise ends the daemon with SIGABRT and restarts it.
void notifyAlive();

}  // namespace ternhad
