#pragma once

#include <optional>
#include <string>
#include <vector>

// Values formatted for people. Times are seconds since 1970, shown in this machine's time zone.
namespace ternhactl {

std::string joined(const std::vector<std::string>& items);
std::string fixedPoint(double value, int decimals);

// The time of day, with the date if it is not that of `now`.
std::string timeOf(double time, double now);

// Formatted as 2026-11-21T14:03:22+0000.
std::string timeStamp(double time);

// " since " and the time, or nothing if it is unknown.
std::string sinceOf(const std::optional<double>& time, double now);

// "12 s", "3 min", "5 h" or "2 d".
std::string duration(double seconds);

// "last known", with its age if that is known.
std::string lastKnown(const std::optional<double>& time, double now);

double currentTime();

}  // namespace ternhactl
