#pragma once

#include <cstdio>
#include <map>
#include <string>

namespace TERN::HA::Daemon {

// The counters of an interface in a listing of network interfaces.
struct InterfaceListing {
    enum class Outcome { READ, NO_TITLE, LINE_TOO_SHORT, OUT_OF_RANGE };

    Outcome outcome = Outcome::READ;
    std::map<std::string, long long> counters;  // by the title of their columns; when READ
    std::string token;                          // the counter that is OUT_OF_RANGE
};

// Read a listing of `ifconfig -s`, to its end unless it fails.
InterfaceListing readInterfaceListing(std::FILE* stream, const std::string& ifname);

}  // namespace TERN::HA::Daemon
