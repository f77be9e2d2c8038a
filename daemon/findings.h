#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>

#include "event.h"
#include "wall_clock.h"

namespace ternhad {

// What the daemon has found out and the health record has no place for. Thread-safe.
class Findings {
 public:
    struct Figure {
        std::optional<double> value;
        std::chrono::system_clock::time_point time;  // of the measurement
        Clock::time_point measured;                  // the same
        bool isStale = false;                        // a later measurement has failed
    };

    // What became of an order to reboot the peer.
    enum class OrderOutcome { none, wentDown, stillAnswers, wasDead, wasUnknown };

    // The peer has replied to a liveness probe. Neither blocks nor allocates.
    void peerReplied() noexcept {
        _lastReply = secondsOf(wallClock());
        _lastReplyTime = Clock::now();
    }

    // Seconds since 1970, 0 before the first reply.
    double lastReply() const noexcept { return _lastReply; }
    Clock::time_point lastReplyTime() const noexcept { return _lastReplyTime; }

    // Of the latest order that has ended.
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

    // The version of this node's DRBD when it is not 8, the only one that tells whether it is connected.
    void setUnsupportedDrbd(const std::string& version) {
        const std::lock_guard<std::mutex> lock(_mutex);
        _unsupportedDrbd = version;
    }
    std::string unsupportedDrbd() const {
        const std::lock_guard<std::mutex> lock(_mutex);
        return _unsupportedDrbd;
    }

    // Whether the peer's report could be read: without it the names of its disks are unknown.
    void setPeerDisksKnown(bool areKnown) noexcept { _arePeerDisksKnown = areKnown; }
    bool arePeerDisksKnown() const noexcept { return _arePeerDisksKnown; }

    void setLatency(double milliseconds) { set(_latency, milliseconds); }

    // The last one, if any, is the last known from now on.
    void setLatencyStale() {
        const std::lock_guard<std::mutex> lock(_mutex);
        _latency.isStale = true;
    }

    // Nothing: it is unknown from now on.
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
