#include "reboot.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "env_check.h"
#include "ha_log.h"
#include "health.h"
#include "passes.h"

namespace ternhad {

namespace {

constexpr auto DEADLINE = std::chrono::seconds(5);
constexpr auto EVENTS_LIMIT = std::chrono::seconds(3);  // leaves time to move them

// Static, because checks have no data members.
Reboot* theReboot = nullptr;
const Health* theHealth = nullptr;

}  // namespace

void Reboot::flush() {
    while (_shutdown.waitFor(_ordered)) {
        if (!_ordered.take()) {
            continue;
        }
        attempt([this] {
            _events.waitUntilWritten(EVENTS_LIMIT);
            TERN::HA::Daemon::daemonLog->writeLogToDisk();
            TERN::HA::Daemon::recordLog->writeLogToDisk();
        });
        sync();  // the trigger reboots without flushing or unmounting
        _flushed.set();
    }
}

void Reboot::order() noexcept {
    if (!_isOrdered) {
        _flushed.take();
        _isOrdered = true;
        _deadline = Clock::now() + DEADLINE;
        _ordered.set();
    }
}

bool Reboot::complete() noexcept {
    if (!_flushed.take() && Clock::now() < _deadline) {
        return true;
    }
    _isOrdered = false;
    const int trigger = open("/proc/sysrq-trigger", O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
    const bool isWritten = trigger >= 0 && write(trigger, "b", 1) == 1;
    if (!isWritten) {
        _events.troubleBegan("reboot at the peer's request", errno);
    }
    if (trigger >= 0) {
        close(trigger);
    }
    return isWritten;
}

std::string RebootCheck::handle(TERN::HA::Daemon::Status&) {
    theReboot->order();
    return "";
}

std::string HostnameCheck::handle(TERN::HA::Daemon::Status&) {
    return theHealth->hostname();
}

void replacePeerChecks(Reboot& reboot, const Health& health) {
    theReboot = &reboot;
    theHealth = &health;
    (*CheckerFactory::opMap)[RebootCheck().getType()] = &createEnvCheckT<RebootCheck>;
    (*CheckerFactory::opMap)[HostnameCheck().getType()] = &createEnvCheckT<HostnameCheck>;
}

}  // namespace ternhad
