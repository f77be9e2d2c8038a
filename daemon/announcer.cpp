#include "announcer.h"

#include <array>
#include <ctime>

#include "journal.h"
#include "passes.h"
#include "service_notifier.h"

namespace ternhad {

namespace {

std::string timeText(std::chrono::system_clock::time_point time) {
    const std::time_t seconds = std::chrono::system_clock::to_time_t(time);
    std::tm fields = {};
    localtime_r(&seconds, &fields);
    std::array<char, 32> text = {};
    const std::size_t size = std::strftime(text.data(), text.size(), "%F %T", &fields);
    return {text.data(), size};
}

}  // namespace

void Announcer::run() {
    Passes passes;
    do {
        _reader.event().take();
        passes.run([this] {
            std::uint64_t lost = 0;
            bool isAny = false;
            while (const auto transition = _reader.next(lost)) {
                announce(*transition);
                isAny = true;
            }
            if (isAny) {
                notifyStatus(summary());
            }
        });
    } while (_shutdown.waitFor(_reader.event()));
}

void Announcer::announce(const Transition& transition) {
    const bool isGood = transition.value == nameOf(transition.flag).isSetGood;
    writeJournal(isGood ? Level::notice : Level::warning,
                 std::string(conditionOf(transition.flag, transition.value)) + " (was " +
                     conditionOf(transition.flag, transition.old) + ')');
}

// The peer's state and whatever is wrong beside it.
std::string Announcer::summary() const {
    const Transitions::State peer = _transitions.state(Flag::peerAlive);
    std::string text = "peer unknown";
    if (peer.value) {
        text = std::string(*peer.value ? "peer alive since " : "peer dead since ") + timeText(peer.since);
    }
    for (const Flag flag : {Flag::peerRebooting, Flag::peerResync, Flag::peerDiskErrors, Flag::drbdConnected,
                            Flag::resync, Flag::diskErrors}) {
        const auto value = _transitions.state(flag).value;
        if (value && *value != nameOf(flag).isSetGood) {
            text += std::string(", ") + conditionOf(flag, value);
        }
    }
    return text;
}

}  // namespace ternhad
