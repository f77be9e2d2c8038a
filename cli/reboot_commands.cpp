#include <iostream>
#include <optional>
#include <string>

#include "client.h"
#include "commands.h"
#include "report.h"

namespace ternhactl {

namespace {

constexpr unsigned int REBOOT_TIMEOUT = 40;  // seconds; the daemon waits up to 33 for the peer to go down

constexpr char WAS_DEAD[] = "was-dead";
constexpr char WENT_DOWN[] = "went-down";

// Ask on the terminal; anything but "y" or "yes" means no.
bool confirm() {
    std::cout << "Reboot the peer at once, without a shutdown? [y/N] " << std::flush;
    std::string answer;
    std::getline(std::cin, answer);
    return answer == "y" || answer == "Y" || answer == "yes";
}

// Older daemons do not report it.
std::string outcomeOf(const Report& before, const Report& after) {
    if (!after.orderOutcome.empty()) {
        return after.orderOutcome;
    }
    if (before.peerAlive.is(false)) {
        return WAS_DEAD;
    }
    return after.peerAlive.is(false) ? WENT_DOWN : "still-answers";
}

// Request the reboot and fetch the report with its outcome. Returns nothing, after a message on
// standard error, if the outcome is unknown; throws NoAnswer if nothing was requested.
std::optional<Report> order(const Settings& settings) {
    const Deadline deadline(REBOOT_TIMEOUT);
    Connection connection(settings, "R", deadline);
    const char* done = "sent";
    try {
        if (!connection.reply(deadline.time)) {
            throw NoAnswer("no reply within " + std::to_string(deadline.seconds) + " s");
        }
        done = "carried out";
        return Report(fetchReport(settings));
    } catch (const NoAnswer& error) {
        if (std::string(error.what()).rfind(REFUSAL, 0) == 0) {
            throw;
        }
        complain(settings, error.what());
        std::cerr << "ternhactl: the reboot request was " << done << ", its outcome is unknown\n";
        return std::nullopt;
    }
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
    std::cout << "Requesting the reboot, waiting up to 33 seconds for the peer to go down...\n" << std::flush;
    const std::optional<Report> after = order(settings);
    if (!after) {
        return ExitCode::Unknown;
    }
    if (!before.peerAlive.value) {
        std::cout << "The peer had not replied yet: it may not have received the request.\n";
        return ExitCode::No;
    }
    const std::string outcome = outcomeOf(before, *after);
    if (outcome == WAS_DEAD) {
        std::cout << "The peer was already dead: it may not have received the request.\n";
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
