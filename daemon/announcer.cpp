#include "announcer.h"

#include <array>
#include <ctime>
#include <utility>

#include "journal.h"
#include "passes.h"
#include "service_notifier.h"
#include "threads.h"

namespace ternhad {

namespace {

constexpr auto REFRESH = std::chrono::seconds(5);  // values become stale without a transition

std::string timeText(std::chrono::system_clock::time_point time) {
    const std::time_t seconds = std::chrono::system_clock::to_time_t(time);
    std::tm fields = {};
    if (localtime_r(&seconds, &fields) == nullptr) {
        return "an unknown time";
    }
    std::array<char, 32> text = {};
    const std::size_t size = std::strftime(text.data(), text.size(), "%F %T", &fields);
    return {text.data(), size};
}

}  // namespace

void Announcer::run() {
    raisePriority(Priority::journal);
    Passes passes;
    do {
        _reader.event().take();
        passes.run([this] {
            std::uint64_t lost = 0;
            while (const auto transition = _reader.next(lost)) {
                if (lost > 0) {
                    writeJournal(Level::warning, std::to_string(lost) + " changes lost");
                }
                announce(*transition);
            }
            announceDrbd();
            if (std::string status = summary(); status != _status) {
                notifyStatus(status);
                _status = std::move(status);
            }
        });
    } while (_shutdown.sleepUntil(Clock::now() + REFRESH, {&_reader.event()}));
}

void Announcer::announce(const Transition& transition) {
    const bool isGood = transition.value == nameOf(transition.flag).isSetGood;
    writeJournal(isGood ? Level::notice : Level::warning,
                 std::string(conditionOf(transition.flag, transition.value)) + " (was " +
                     conditionOf(transition.flag, transition.old) + ')');
}

void Announcer::announceDrbd() {
    std::string version = _findings.unsupportedDrbd();
    if (version != _unsupportedDrbd && !version.empty()) {
        writeJournal(Level::warning, "DRBD " + version + " is not supported, 8.4 is");
    }
    _unsupportedDrbd = std::move(version);
}

// Return the state of the peer and all problems, or the last known ones.
std::string Announcer::summary() const {
    const Transitions::State peer = _transitions.state(Flag::peerAlive);
    std::string text = "peer unknown";
    if (peer.value) {
        text = std::string(*peer.value ? "peer alive since " : "peer dead since ") + timeText(peer.since);
    }
    std::string lastKnown;
    for (const Flag flag : {Flag::peerRebooting, Flag::peerResync, Flag::peerDiskErrors, Flag::drbdConnected,
                            Flag::resync, Flag::diskErrors}) {
        const Transitions::State state = _transitions.state(flag);
        if (state.value && *state.value != nameOf(flag).isSetGood) {
            (state.isStale ? lastKnown : text) += std::string(", ") + conditionOf(flag, state.value);
        }
    }
    if (!_unsupportedDrbd.empty()) {
        text += ", DRBD " + _unsupportedDrbd + " is not supported";
    }
    return lastKnown.empty() ? text : text + "; last known: " + lastKnown.substr(2);
}

}  // namespace ternhad
