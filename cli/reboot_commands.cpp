#include <iostream>

#include "client.h"
#include "commands.h"
#include "report.h"

namespace ternhactl {

namespace {

constexpr unsigned int REBOOT_TIMEOUT = 40;  // seconds; the daemon follows the peer down for up to 33

constexpr char WAS_DEAD[] = "was-dead";
constexpr char WENT_DOWN[] = "went-down";

// Asks on the terminal; anything but "y" or "yes" is no.
bool confirm() {
    std::cout << "Reboot the peer at once, without a shutdown? [y/N] " << std::flush;
    std::string answer;
    std::getline(std::cin, answer);
    return answer == "y" || answer == "Y" || answer == "yes";
}

// An older daemon does not tell.
std::string outcomeOf(const Report& before, const Report& after) {
    if (!after.orderOutcome.empty()) {
        return after.orderOutcome;
    }
    if (before.peerAlive.is(false)) {
        return WAS_DEAD;
    }
    return after.peerAlive.is(false) ? WENT_DOWN : "still-answers";
}

}  // namespace

ExitCode rebooting(const Settings& settings) {
    const bool isRebooting = Report(fetchReport(settings)).peerRebooting.is(true);
    std::cout << (isRebooting ? "yes\n" : "no\n");
    return isRebooting ? ExitCode::Success : ExitCode::No;
}

ExitCode rebootPeer(const Settings& settings) {
    if (!settings.isConfirmed && !confirm()) {
        std::cout << "Nothing done.\n";
        return ExitCode::No;
    }
    const Report before(fetchReport(settings));
    if (before.peerRebooting.is(true) && before.peerAlive.is(true)) {
        std::cout << "The peer is being rebooted already. Nothing done.\n";
        return ExitCode::No;
    }
    std::cout << "Ordering the reboot and following the peer down, up to 33 seconds...\n" << std::flush;
    ask(settings, "R", Deadline(REBOOT_TIMEOUT));
    if (!before.peerAlive.value) {
        std::cout << "The peer has not been probed yet: nobody knows whether it heard the order.\n";
        return ExitCode::No;
    }
    const std::string outcome = outcomeOf(before, Report(fetchReport(settings)));
    if (outcome == WAS_DEAD) {
        std::cout << "The peer was already dead: nobody knows whether it heard the order.\n";
        return ExitCode::No;
    }
    if (outcome != WENT_DOWN) {
        std::cout << "The peer still answers: it was not rebooted.\n";
        return ExitCode::No;
    }
    std::cout << "The peer went down, or the link to it. It counts as rebooting until it replies again.\n";
    return ExitCode::Success;
}

}  // namespace ternhactl
