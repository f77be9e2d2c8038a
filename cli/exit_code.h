#pragma once

namespace ternhactl {

// The process's exit codes. `check` uses the first four as monitoring plugins do: OK, warning, critical and
// unknown.
enum class ExitCode {
    Success = 0,      // done; rebooting: yes; check: all is well
    No = 1,           // rebooting: no; reboot-peer: not confirmed; check: a failover would be unwise
    Critical = 2,     // check: the peer or the DRBD link is down
    NoAnswer = 3,     // the daemon does not answer or cannot be reached
    WrongUsage = 64,  // the command line is wrong
};

}  // namespace ternhactl
