#pragma once

#include <json/value.h>

#include <chrono>
#include <optional>
#include <stdexcept>
#include <string>

#include "settings.h"

namespace ternhactl {

// Prefix of what ternhad sends for a refused request; the reason follows.
inline constexpr char REFUSAL[] = "refused: ";

// The daemon does not reply; what() is the reason.
struct NoAnswer : std::runtime_error {
    using std::runtime_error::runtime_error;
};

// The daemon closed the connection without a reply: it does not know the request or is out of
// connections.
struct Refused : NoAnswer {
    using NoAnswer::NoAnswer;
};

// Return the deadline `seconds` from now.
struct Deadline {
    using Clock = std::chrono::steady_clock;

    explicit Deadline(unsigned int limit)
        : seconds(limit), time(Clock::now() + std::chrono::seconds(limit)) {}

    unsigned int seconds;
    Clock::time_point time;
};

// A connection to the daemon for one request.
class Connection {
 public:
    using Clock = Deadline::Clock;

    // Connect and send {"act": `action`}. Throws NoAnswer.
    Connection(const Settings& settings, const std::string& action, const Deadline& deadline);
    ~Connection();

    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;

    // Return the reply up to the end of the connection, or its next line. Returns nothing on
    // timeout; throws Refused if the connection ended without one.
    std::optional<Json::Value> reply(Clock::time_point deadline);
    std::optional<Json::Value> line(Clock::time_point deadline);

 private:
    enum class Input { Data, End, Timeout };
    Input receive(Clock::time_point deadline);

    int _fd;
    std::string _buffer;
};

// Return the reply to {"act": `action`}, which must arrive by `deadline`. Throws NoAnswer.
Json::Value ask(const Settings& settings, const std::string& action, const Deadline& deadline);

}  // namespace ternhactl
