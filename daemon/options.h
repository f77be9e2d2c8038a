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
    std::string interface;  // network interface of that link
    std::string socket = "/run/ternha/control.sock";
    Seconds checkInterval = Seconds(1);        // liveness probes while replies arrive; local and peer checks
    Seconds deadAfter = Seconds(3);            // dead after this time without proof that it is alive
    Seconds heartbeatInterval = Seconds(10);   // latency and packet rate of the link
    Seconds logInterval = Seconds(10);         // moving buffered lines to disk
    Seconds snapshotInterval = Seconds(3600);  // snapshots of status, processes, file systems and memory
    std::string notify;                        // program to run at each state transition; empty: none
    std::string statusSocket;                  // read-only socket; empty: none
    std::string statusGroup;                   // group that may use it
    unsigned int statusGroupId = 0;
    bool isCheckOnly = false;           // print the configuration and exit
    std::int64_t rotateSize = 1048576;  // size of a log that triggers rotation, bytes
};

// Flush standard output. Returns false, after a message on standard error, if it cannot be written.
bool isPrinted();

// Parse the command line and the configuration file that it names. Returns the exit code if the
// process is to exit now: 0 after --help and --version, 2 after an error message on standard error.
std::optional<int> parseOptions(int argc, const char* const* argv, Options& options);

}  // namespace ternhad
