#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

namespace ternhad {

using Seconds = std::chrono::duration<double>;

struct Options {
    std::string localIp;    // this node's address on the replication link, dotted quad
    std::string remoteIp;   // the peer's
    std::string interface;  // the network interface of that link
    std::string socket = "/run/ternha/control.sock";
    Seconds checkInterval = Seconds(1);        // probes while replies come; local and peer checks
    Seconds deadAfter = Seconds(3);            // dead after this time without proof that it is alive
    Seconds heartbeatInterval = Seconds(10);   // latency and the interface's rate
    Seconds logInterval = Seconds(10);         // buffered lines to disk
    Seconds snapshotInterval = Seconds(3600);  // recording of status, processes, file systems and memory
    std::string notify;                        // a program to run at each change; empty: none
    std::string statusSocket;                  // for clients that only read; empty: none
    std::string statusGroup;                   // who may use it
    unsigned int statusGroupId = 0;
    bool isCheckOnly = false;           // print the configuration and end
    std::int64_t rotateSize = 1048576;  // bytes of a log at which it is rotated
};

// Flushes standard output. False, after a message on standard error, when it cannot be written.
bool isPrinted();

// Reads the command line and the configuration file that it names. Returns the exit code when the process is
// to end at once: 0 after --help and --version, 2 after a message on standard error about what is wrong.
std::optional<int> parseOptions(int argc, const char* const* argv, Options& options);

}  // namespace ternhad
