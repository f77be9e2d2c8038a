#include "interface_listing.h"

#include <climits>
#include <cstdlib>
#include <vector>

#include "text.h"

namespace TERN::HA::Daemon {

namespace {

// Map the title of each counter to the index of its column.
std::map<std::string, long long> columnsOf(const std::vector<std::string>& title) {
    std::map<std::string, long long> columns;
    long long index = 0;
    for (const std::string& column : title) {
        if (startsWith(column, "RX") || startsWith(column, "TX")) {
            columns.emplace(column, index);
        }
        ++index;
    }
    return columns;
}

}  // namespace

InterfaceListing readInterfaceListing(std::FILE* stream, const std::string& ifname) {
    using Outcome = InterfaceListing::Outcome;
    Line line = {};
    if (readLine(stream, line).empty()) {
        return {Outcome::NO_TITLE, {}, {}};
    }
    // Frozen: docs/compatibility.md#unknown-title
    const std::vector<std::string> title =
        startsWith(line.data(), "Iface") ? split(line.data()) : std::vector<std::string>();
    // Frozen: docs/compatibility.md#unlisted-interface
    InterfaceListing listing = {Outcome::READ, columnsOf(title), {}};
    bool isFound = false;
    while (!readLine(stream, line).empty()) {
        // Frozen: docs/compatibility.md#interface-prefix
        // A prefix suffices (eth1 finds eth10 as well); the first such line counts.
        if (isFound || listing.counters.empty() || !startsWith(line.data(), ifname)) {
            continue;
        }
        isFound = true;
        const std::vector<std::string> tokens = split(line.data());
        if (tokens.size() < title.size()) {
            return {Outcome::LINE_TOO_SHORT, {}, {}};
        }
        for (auto& [name, value] : listing.counters) {
            const auto index = static_cast<std::size_t>(value);
            // Frozen: docs/compatibility.md#counter-bases
            value = std::strtoll(tokens[index].c_str(), nullptr, 0);
            if (value == LLONG_MAX || value == LLONG_MIN) {
                return {Outcome::OUT_OF_RANGE, {}, tokens[index]};
            }
        }
    }
    return listing;
}

}  // namespace TERN::HA::Daemon
