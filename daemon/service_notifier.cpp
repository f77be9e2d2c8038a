#include "service_notifier.h"

#ifdef TERNHA_HAS_SYSTEMD
#include <systemd/sd-daemon.h>

#include <cstdint>
#endif

namespace ternhad {

#ifdef TERNHA_HAS_SYSTEMD

namespace {

// Keep NOTIFY_SOCKET in the environment for the next notification. A failed notification is lost;
// the manager falls back to its own time limits.
constexpr int KEEP_ENVIRONMENT = 0;

}  // namespace

void notifyReady() {
    sd_notify(KEEP_ENVIRONMENT, "READY=1");
}

void notifyStopping() {
    sd_notify(KEEP_ENVIRONMENT, "STOPPING=1");
}

void notifyStatus(const std::string& status) {
    sd_notify(KEEP_ENVIRONMENT, ("STATUS=" + status).c_str());
}

std::optional<std::chrono::microseconds> watchdogInterval() {
    std::uint64_t interval = 0;
    if (sd_watchdog_enabled(KEEP_ENVIRONMENT, &interval) <= 0) {
        return std::nullopt;
    }
    return std::chrono::microseconds(interval);
}

void notifyAlive() {
    sd_notify(KEEP_ENVIRONMENT, "WATCHDOG=1");
}

#else

void notifyReady() {}

void notifyStopping() {}

void notifyStatus(const std::string&) {}

std::optional<std::chrono::microseconds> watchdogInterval() {
    return std::nullopt;
}

void notifyAlive() {}

#endif

}  // namespace ternhad
