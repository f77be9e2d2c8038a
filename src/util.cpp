#include "util.h"

#include <array>
#include <optional>

#include "file.h"
#include "ha_log.h"
#include "json_text.h"
#include "terncore.h"

namespace TERN::HA::Daemon::Util {

namespace {

constexpr char PACKAGE_CONFIG[] = "/usr/tern/etc/packages/FailoverPair/ha.conf";
constexpr char DISK_TABLE[] = "/tmp/ha/info_hd.remote";
constexpr std::size_t DISK_TABLE_LIMIT = 1048576;

// Return the disk table, a JSON object by position; null when it is missing.
Json::Value readDiskTable() {
    Json::Value table;
    if (!PLATFileExist(DISK_TABLE)) {
        return table;
    }
    const std::string text = readSmallFile(DISK_TABLE, DISK_TABLE_LIMIT + 1, Owner::any);
    if (text.size() > DISK_TABLE_LIMIT || !parseJson(text, table)) {
        HA_LOG(std::string("Failed to read HD info json: ") + DISK_TABLE);
    }
    return table.isObject() ? table : Json::Value();
}

// Return the human-readable name of the disk at `position`: a slot of the main unit (M or 0-M) or
// of an enclosure (N-M).
std::string readableName(const std::string& position, const std::string& container) {
    const std::size_t dash = position.find('-');
    if (dash == std::string::npos) {
        // Frozen: docs/compatibility.md#two-spellings-of-disk
        return "Disk " + position;
    }
    const std::string slot = "disk " + position.substr(dash + 1);
    // Frozen: docs/compatibility.md#empty-brackets
    return position.substr(0, dash) == "0" ? slot : slot + "(" + container + ")";
}

}  // namespace

std::string getHAHostname() {
    std::array<char, 64> name = {};
    if (PLATFileGetKeyValue(PACKAGE_CONFIG, "ha_hostname", name.data(), static_cast<int>(name.size()), 0) <
        1) {
        HA_LOG("Failed to get ha hostname");
    }
    return name.data();
}

std::vector<std::string> devListToHumanReadable(const std::vector<std::string>& devices) {
    const Json::Value table = readDiskTable();
    if (table.empty()) {
        return devices;
    }
    // Convert the entries once: every device is compared with all of them.
    struct Disk {
        std::string device;
        std::string name;
    };
    std::vector<Disk> disks;
    for (auto member = table.begin(); member != table.end(); ++member) {
        if (!member->isObject()) {
            continue;
        }
        const std::optional<std::string> device = readString((*member)["HD_DEVNAME"]);
        const std::optional<std::string> container = readString((*member)["HD_CONTAINER"]);
        if (device && container) {
            disks.push_back({*device, readableName(member.name(), *container)});
        }
    }
    std::vector<std::string> names;
    for (const std::string& device : devices) {
        for (const Disk& disk : disks) {
            // Frozen: docs/compatibility.md#dropped-devices
            if (disk.device == device) {
                names.push_back(disk.name);
            }
        }
    }
    return names;
}

}  // namespace TERN::HA::Daemon::Util
