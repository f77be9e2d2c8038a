#include "check_config.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <sys/stat.h>

#include <cstring>
#include <sstream>

namespace ternhad {

namespace {

// Return whether the interface has the address.
bool hasAddress(const std::string& interface, const std::string& address) {
    in_addr wanted = {};
    inet_pton(AF_INET, address.c_str(), &wanted);
    ifaddrs* addresses = nullptr;
    if (getifaddrs(&addresses) != 0) {
        return true;
    }
    bool isFound = false;
    for (const ifaddrs* entry = addresses; entry != nullptr; entry = entry->ifa_next) {
        if (entry->ifa_addr != nullptr && entry->ifa_addr->sa_family == AF_INET &&
            interface == entry->ifa_name) {
            sockaddr_in found = {};
            std::memcpy(&found, entry->ifa_addr, sizeof found);  // `ifa_addr` may be unaligned
            isFound = isFound || found.sin_addr.s_addr == wanted.s_addr;
        }
    }
    freeifaddrs(addresses);
    return isFound;
}

}  // namespace

std::string configurationText(const Options& options) {
    std::ostringstream text;
    text << "local-ip = " << options.localIp << "\nremote-ip = " << options.remoteIp
         << "\ninterface = " << options.interface << "\nsocket = " << options.socket
         << "\ncheck-interval = " << options.checkInterval.count()
         << "\ndead-after = " << options.deadAfter.count()
         << "\nheartbeat-interval = " << options.heartbeatInterval.count()
         << "\nlog-interval = " << options.logInterval.count()
         << "\nsnapshot-interval = " << options.snapshotInterval.count()
         << "\nrotate-size = " << options.rotateSize << '\n';
    if (!options.notify.empty()) {
        text << "notify = " << options.notify << '\n';
    }
    if (!options.statusSocket.empty()) {
        text << "status-socket = " << options.statusSocket << "\nstatus-group = " << options.statusGroup
             << '\n';
    }
    return text.str();
}

std::vector<std::string> warningsOf(const Options& options) {
    std::vector<std::string> warnings;
    if (if_nametoindex(options.interface.c_str()) == 0) {
        warnings.push_back("there is no network interface " + options.interface +
                           " (yet): its packet rate is unknown");
    } else if (!hasAddress(options.interface, options.localIp)) {
        warnings.push_back("interface " + options.interface + " does not have the address " +
                           options.localIp);
    }
    struct stat info = {};
    if (!options.notify.empty() && stat(options.notify.c_str(), &info) == 0 &&
        (info.st_uid != 0 || (info.st_mode & (S_IWGRP | S_IWOTH)) != 0)) {
        warnings.push_back("notify program " + options.notify + " can be changed by others than root");
    }
    return warnings;
}

}  // namespace ternhad
