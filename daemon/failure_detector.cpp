#include "failure_detector.h"

#include <algorithm>

namespace ternhad {

FailureDetector::FailureDetector(Duration checkInterval, Duration deadAfter, Time now)
    : _checkInterval(checkInterval),
      _deadAfter(deadAfter),
      _fastInterval(deadAfter / 20),
      _missedAfter(deadAfter / 10),
      // Probes sent before the first one is missed, then those at the fast interval until
      // `deadAfter`, and some to spare.
      _probes(static_cast<std::size_t>(_missedAfter / checkInterval + deadAfter / _fastInterval + 4)),
      _now(now),
      _lastAttempt(now - checkInterval),
      _lastProof(now) {}

void FailureDetector::wakeUp(Time now) noexcept {
    // Ignore small delays, which are normal on a busy machine.
    const Time latest = wakeUpTime() + _fastInterval;
    const Duration elapsed = now - _now;
    if (_isBlocked) {
        discount(elapsed);
    } else if (now > latest) {
        discount(std::min(now - latest, elapsed));
    }
    _now = now;
    for (Probe& probe : _probes) {
        probe.isAwaited = probe.isAwaited && now - probe.sent < _deadAfter;
    }
}

void FailureDetector::discount(Duration time) noexcept {
    _lastProof += time;
    for (Probe& probe : _probes) {
        probe.sent += time;
    }
}

FailureDetector::Time FailureDetector::wakeUpTime() const noexcept {
    // While blocked, no time counts.
    return _isBlocked || isPeerDead() ? probeTime() : std::min(probeTime(), _lastProof + _deadAfter);
}

FailureDetector::Time FailureDetector::probeTime() const noexcept {
    if (_isBlocked) {
        return _lastAttempt + _fastInterval;
    }
    const Time regular = _lastAttempt + _checkInterval;
    Time missed = Time::max();  // when the earliest probe is missed
    for (const Probe& probe : _probes) {
        if (probe.isAwaited) {
            missed = std::min(missed, probe.sent + _missedAfter);
        }
    }
    if (isPeerDead()) {
        return regular;
    }
    return missed <= _now ? std::max(missed, _lastAttempt + _fastInterval) : std::min(regular, missed);
}

void FailureDetector::probeSent() noexcept {
    _probes[_next] = {_now, true};
    _next = (_next + 1) % _probes.size();
    _lastAttempt = _now;
    _isBlocked = false;
}

void FailureDetector::probeNotSent() noexcept {
    _lastAttempt = _now;
    _isBlocked = true;
}

void FailureDetector::replyReceived(std::size_t probe) noexcept {
    if (!_probes[probe].isAwaited) {
        return;
    }
    const Time proof = _probes[probe].sent;
    _lastProof = _isProven ? std::max(_lastProof, proof) : proof;
    _isProven = true;
    for (Probe& other : _probes) {
        other.isAwaited = other.isAwaited && other.sent > proof;  // earlier probes prove nothing new
    }
}

}  // namespace ternhad
