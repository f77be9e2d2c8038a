#pragma once

#include <json/value.h>

#include <chrono>
#include <optional>
#include <stdexcept>
#include <string>

#include "settings.h"

namespace ternhactl {

// What ternhad sends in place of a reply that it refuses; a reason follows.
inline constexpr char REFUSAL[] = "refused: ";

// The daemon does not answer; what() tells why.
struct NoAnswer : std::runtime_error {
    using std::runtime_error::runtime_error;
};

// The daemon closed the connection without a reply: it does not know the request, or serves no more clients.
struct Refused : NoAnswer {
    using NoAnswer::NoAnswer;
};

// When to give up: after `seconds` from now, whatever the daemon does.
struct Deadline {
    using Clock = std::chrono::steady_clock;

    explicit Deadline(unsigned int limit)
        : seconds(limit), time(Clock::now() + std::chrono::seconds(limit)) {}

    unsigned int seconds;
    Clock::time_point time;
};

// A connection to the daemon that carries one request.
class Connection {
 public:
    using Clock = Deadline::Clock;

    // Connects and sends {"act": `action`}. Throws NoAnswer.
    Connection(const Settings& settings, const std::string& action, const Deadline& deadline);
    ~Connection();

    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;

    // The reply up to the end of the connection, or of its next line for replies of several. Nothing when
    // `deadline` has passed first; throws Refused at the end of the connection.
    std::optional<Json::Value> reply(Clock::time_point deadline);
    std::optional<Json::Value> line(Clock::time_point deadline);

 private:
    enum class Input { Data, End, Timeout };
    Input receive(Clock::time_point deadline);

    int _fd;
    std::string _buffer;
};

// The reply to {"act": `action`}, which must come by `deadline`. Throws NoAnswer.
Json::Value ask(const Settings& settings, const std::string& action, const Deadline& deadline);

}  // namespace ternhactl
