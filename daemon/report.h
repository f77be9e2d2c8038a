#pragma once

#include <json/value.h>

#include <cstdint>

#include "health.h"
#include "options.h"
#include "transitions.h"

namespace ternhad {

// Makes the report, version 1, for clients of the control socket.
class Reporter {
 public:
    Reporter(const Options& options, Health& health) : _options(options), _health(health) {}

    Json::Value report() const;

    // Return the JSON of an event, and of events that were lost before one.
    static Json::Value event(const Transition& transition);
    static Json::Value lostEvents(std::uint64_t count);

 private:
    Json::Value flag(Flag flag) const;
    Json::Value figure(const Findings::Figure& figure) const;

    const Options& _options;
    Health& _health;
    double _started = secondsOf(wallClock());
};

}  // namespace ternhad
