#pragma once

#include <chrono>
#include <cstddef>
#include <vector>

namespace ternhad {

// Decides whether the peer is alive from the times of probes and replies alone. Not thread-safe;
// allocates only in its constructor.
//
// The peer is dead after `deadAfter` without proof that it is alive. A reply proves that it was
// alive when its probe was sent. Time in which this process did not run, or could not send for
// local reasons, does not count. Before the first reply the peer is unknown for that time, then
// dead.
class FailureDetector {
 public:
    using Clock = std::chrono::steady_clock;
    using Time = Clock::time_point;
    using Duration = Clock::duration;

    // checkInterval: between two probes while replies arrive, at most a third of deadAfter.
    FailureDetector(Duration checkInterval, Duration deadAfter, Time now);

    // To be called first at each wake-up. A delay after wakeUpTime() counts as time in which this
    // process did not run.
    void wakeUp(Time now) noexcept;

    // Return the latest time for the next call of wakeUp().
    Time wakeUpTime() const noexcept;

    // Maximum number of probes in flight; they are numbered from 0.
    std::size_t capacity() const noexcept { return _probes.size(); }
    bool isAwaited(std::size_t probe) const noexcept { return _probes[probe].isAwaited; }

    bool isProbeDue() const noexcept { return _now >= probeTime(); }

    // Return the number of the next probe. A reply to the previous probe of that number no longer
    // counts.
    std::size_t nextProbe() const noexcept { return _next; }

    // Probe nextProbe() has been sent.
    void probeSent() noexcept;

    // A probe was due and could not be sent for lack of a local resource.
    void probeNotSent() noexcept;

    void replyReceived(std::size_t probe) noexcept;

    // State as of the last wakeUp() and the replies since.
    bool isPeerAlive() const noexcept { return _isProven && !isPeerDead(); }
    bool isPeerDead() const noexcept { return _now - _lastProof >= _deadAfter; }

 private:
    struct Probe {
        Time sent;
        bool isAwaited = false;
    };

    Time probeTime() const noexcept;
    void discount(Duration time) noexcept;

    Duration _checkInterval;
    Duration _deadAfter;
    Duration _fastInterval;  // between two probes while one is missed
    Duration _missedAfter;   // a probe without a reply for this time is missed
    std::vector<Probe> _probes;
    std::size_t _next = 0;
    Time _now;
    Time _lastAttempt;
    Time _lastProof;  // that the peer is alive; initially the start
    bool _isProven = false;
    bool _isBlocked = false;  // the last probe could not be sent
};

}  // namespace ternhad
