#pragma once

#include <chrono>
#include <cstddef>
#include <vector>

namespace ternhad {

// Decides whether the peer is alive, from probes and replies alone: times go in, decisions come out. Not
// thread-safe; allocates in its constructor only.
//
// The peer is dead when it has not been proven alive for `deadAfter`. A reply proves that it was alive when
// the probe that it answers was sent. Time in which this process did not run, or could not send for reasons
// of its own, does not count. Before the first reply the peer is neither alive nor, until the time is up,
// dead.
class FailureDetector {
 public:
    using Clock = std::chrono::steady_clock;
    using Time = Clock::time_point;
    using Duration = Clock::duration;

    // checkInterval: between two probes while replies come, at most a third of deadAfter.
    FailureDetector(Duration checkInterval, Duration deadAfter, Time now);

    // Call first at each wake-up. The time by which it comes later than wakeUpTime() promised is time in
    // which this process did not run.
    void wakeUp(Time now) noexcept;

    // When to call wakeUp() next at the latest.
    Time wakeUpTime() const noexcept;

    // Probes that may await their replies at the same time: numbers below this identify them.
    std::size_t capacity() const noexcept { return _probes.size(); }
    bool isAwaited(std::size_t probe) const noexcept { return _probes[probe].isAwaited; }

    bool isProbeDue() const noexcept { return _now >= probeTime(); }

    // The number of the next probe. A reply to an earlier probe of that number counts no more.
    std::size_t nextProbe() const noexcept { return _next; }

    // The probe nextProbe() has left this node now.
    void probeSent() noexcept;

    // A probe was due and could not leave for lack of this node's own means.
    void probeNotSent() noexcept;

    void replyReceived(std::size_t probe) noexcept;

    // The decision as of the last wakeUp() and the replies since.
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
    Duration _fastInterval;  // between two probes once one misses its reply
    Duration _missedAfter;   // without a reply for so long a probe is missed
    std::vector<Probe> _probes;
    std::size_t _next = 0;
    Time _now;
    Time _lastAttempt;
    Time _lastProof;  // of life; the beginning, before the first one
    bool _isProven = false;
    bool _isBlocked = false;  // the last attempt to send failed
};

}  // namespace ternhad
