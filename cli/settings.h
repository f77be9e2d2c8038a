#pragma once

#include <optional>
#include <string>

namespace ternhactl {

// The command line.
struct Settings {
    enum class Json { None, Record, Version1 };

    std::string socket = "/run/ternha/control.sock";
    unsigned int timeout = 5;  // seconds
    Json json = Json::None;
    double watchInterval = 0;  // seconds, 0: once
    bool isConfirmed = false;
    bool isSelfOnly = false;          // check: this node only
    std::string output;               // a file; empty: standard output
    std::string condition;            // that `wait` waits for
    std::optional<double> waitLimit;  // seconds; none: no limit
};

// Exit codes. `check` uses the first four as monitoring plugins do: OK, warning, critical, unknown.
enum class ExitCode {
    Success = 0,       // done; rebooting: yes; check: all is well
    No = 1,            // rebooting: no; reboot-peer: not rebooted; wait: not in time; check: warning
    Critical = 2,      // check: the peer or the DRBD link is down
    Unknown = 2,       // reboot-peer: ordered, but the outcome is unknown
    NoAnswer = 3,      // the daemon does not reply or cannot be reached; check: unknown
    WrongUsage = 64,   // the command line is wrong
    OutputError = 74,  // the output cannot be written
};

}  // namespace ternhactl
