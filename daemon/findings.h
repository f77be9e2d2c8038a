#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>

#include "event.h"
#include "wall_clock.h"

namespace ternhad {

// Data about peer and link that the status record has no field for. Thread-safe.
class Findings {
 public:
    struct Figure {
        std::optional<double> value;
        std::chrono::system_clock::time_point time;  // of the measurement
        Clock::time_point measured;                  // the same on the monotonic clock
        bool isStale = false;                        // a later measurement has failed
    };

    // Outcome of a reboot request to the peer.
    enum class OrderOutcome { none, wentDown, stillAnswers, wasDead, wasUnknown };

    // Record a reply to a liveness probe. Neither blocks nor allocates.
    void peerReplied() noexcept {
        _lastReply = secondsOf(wallClock());
        _lastReplyTime = Clock::now();
    }

    // Seconds since 1970; 0 before the first reply.
    double lastReply() const noexcept { return _lastReply; }
    Clock::time_point lastReplyTime() const noexcept { return _lastReplyTime; }

    // Outcome of the latest completed request.
    void setOrderOutcome(OrderOutcome outcome) noexcept { _orderOutcome = outcome; }
    OrderOutcome orderOutcome() const noexcept { return _orderOutcome; }

    void setPeerName(const std::string& name) {
        const std::lock_guard<std::mutex> lock(_mutex);
        _peerName = name;
    }
    std::string peerName() const {
        const std::lock_guard<std::mutex> lock(_mutex);
        return _peerName;
    }

    // Version of this node's DRBD unless it is 8, the only one whose connection state is known.
    void setUnsupportedDrbd(const std::string& version) {
        const std::lock_guard<std::mutex> lock(_mutex);
        _unsupportedDrbd = version;
    }
    std::string unsupportedDrbd() const {
        const std::lock_guard<std::mutex> lock(_mutex);
        return _unsupportedDrbd;
    }

    // Whether the peer's disk report could be parsed: otherwise the names of its disks are unknown.
    void setPeerDisksKnown(bool areKnown) noexcept { _arePeerDisksKnown = areKnown; }
    bool arePeerDisksKnown() const noexcept { return _arePeerDisksKnown; }

    void setLatency(double milliseconds) { set(_latency, milliseconds); }

    // Mark the last value, if any, as stale.
    void setLatencyStale() {
        const std::lock_guard<std::mutex> lock(_mutex);
        _latency.isStale = true;
    }

    // std::nullopt: unknown from now on.
    void setNonOkRate(std::optional<double> rate) { set(_nonOkRate, rate); }

    Figure latency() const { return get(_latency); }
    Figure nonOkRate() const { return get(_nonOkRate); }

 private:
    void set(Figure& figure, std::optional<double> value) {
        const std::lock_guard<std::mutex> lock(_mutex);
        figure = {value, wallClock(), Clock::now()};
    }
    Figure get(const Figure& figure) const {
        const std::lock_guard<std::mutex> lock(_mutex);
        return figure;
    }

    std::atomic<double> _lastReply{0};
    std::atomic<Clock::time_point> _lastReplyTime{Clock::time_point()};
    std::atomic<OrderOutcome> _orderOutcome{OrderOutcome::none};
    std::atomic<bool> _arePeerDisksKnown{false};
    mutable std::mutex _mutex;  // guards the rest
    std::string _peerName;
    std::string _unsupportedDrbd;
    Figure _latency;
    Figure _nonOkRate;
};

}  // namespace ternhad
