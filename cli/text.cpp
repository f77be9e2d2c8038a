#include "text.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <ctime>
#include <iomanip>
#include <sstream>

namespace ternhactl {

namespace {

constexpr double MINUTE = 60;
constexpr double HOUR = 60 * MINUTE;
constexpr double DAY = 24 * HOUR;

std::string formatted(double time, const char* format) {
    const auto seconds = static_cast<std::time_t>(time);
    std::tm fields = {};
    (void)localtime_r(&seconds, &fields);
    std::ostringstream text;
    text << std::put_time(&fields, format);
    return text.str();
}

}  // namespace

std::string joined(const std::vector<std::string>& items) {
    std::string text;
    for (const std::string& item : items) {
        text += (text.empty() ? "" : ", ") + item;
    }
    return text;
}

std::string fixedPoint(double value, int decimals) {
    std::ostringstream text;
    text << std::fixed << std::setprecision(decimals) << value;
    return text.str();
}

std::string timeOf(double time, double now) {
    const bool isToday = formatted(time, "%F") == formatted(now, "%F");
    return formatted(time, isToday ? "%H:%M:%S" : "%F %H:%M:%S");
}

std::string sinceOf(const std::optional<double>& time, double now) {
    return time ? " since " + timeOf(*time, now) : std::string();
}

std::string duration(double seconds) {
    const double value = std::max(seconds, 0.0);
    if (value < 2 * MINUTE) {
        return fixedPoint(std::floor(value), 0) + " s";
    }
    if (value < 2 * HOUR) {
        return fixedPoint(std::floor(value / MINUTE), 0) + " min";
    }
    if (value < 2 * DAY) {
        return fixedPoint(std::floor(value / HOUR), 0) + " h";
    }
    return fixedPoint(std::floor(value / DAY), 0) + " d";
}

std::string lastKnown(const std::optional<double>& time, double now) {
    return "last known" + (time ? ' ' + duration(now - *time) + " ago" : std::string());
}

std::string timeStamp(double time) {
    return formatted(time, "%FT%T%z");
}

double currentTime() {
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

}  // namespace ternhactl
