#pragma once

#include <cstdio>
#include <map>
#include <string>

namespace TERN::HA::Daemon {

// What a listing of network interfaces tells of one of them.
struct InterfaceListing {
    enum class Outcome { READ, NO_TITLE, LINE_TOO_SHORT, OUT_OF_RANGE };

    Outcome outcome = Outcome::READ;
    std::map<std::string, long long> counters;  // by the title of their columns; when READ
    std::string token;                          // the counter that is OUT_OF_RANGE
};

// Reads a listing as `ifconfig -s` prints it, to its end unless the outcome is a failure.
InterfaceListing readInterfaceListing(std::FILE* stream, const std::string& ifname);

}  // namespace TERN::HA::Daemon
