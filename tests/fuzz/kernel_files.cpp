// /proc/drbd and the files of md arrays and ATA ports. The first byte selects the file.
#include <json/value.h>

#include <array>
#include <filesystem>

#include "checker.h"
#include "fuzz/fuzz.h"

namespace {

using namespace TERN::HA::Daemon;

constexpr char SYNC_ACTION[] = "/sys/block/md0/md/sync_action";
constexpr char ERROR_HANDLING[] = "/sys/class/ata_port/ata1/error_handling";

bool hasLinkedState(const std::string& text) {
    constexpr std::array<const char*, 13> LINKED = {
        "WFReportParams", "Connected",  "StartingSyncS", "StartingSyncT", "WFBitMapS",
        "WFBitMapT",      "WFSyncUUID", "SyncSource",    "SyncTarget",    "PausedSyncS",
        "PausedSyncT",    "VerifyS",    "VerifyT"};
    for (const char* state : LINKED) {
        if (text.find(state) != std::string::npos) {
            return true;
        }
    }
    return false;
}

}  // namespace

int LLVMFuzzerInitialize(int* /*argc*/, char*** /*argv*/) {
    fuzz::prepareLog();
    const char* const disk = "/sys/devices/pci0/ata1/host0/target0:0:0/0:0:0:0/block/sda";
    std::filesystem::create_directories(disk);
    std::filesystem::create_directories("/sys/block");
    std::filesystem::create_symlink(disk, "/sys/block/sda");
    fuzz::writeFile(SYNC_ACTION, "");
    fuzz::writeFile(ERROR_HANDLING, "");
    return 0;
}

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size == 0) {
        return 0;
    }
    const std::string content = fuzz::text(data + 1, size - 1);
    const std::string firstLine = content.substr(0, content.find('\n'));
    switch (data[0] % 3) {
        case 0:
            fuzz::writeFile("/proc/drbd", content);
            fuzz::require(isDRBDConnect() == hasLinkedState(content),
                          "connected is what names a linked state");
            break;
        case 1:
            fuzz::writeFile(SYNC_ACTION, content);
            fuzz::require(isMDResync() == (firstLine == "resync"),
                          "only a first line \"resync\" is a resync");
            break;
        default: {
            fuzz::writeFile(ERROR_HANDLING, content);
            Json::Value disks;
            const bool isHandling = isDiskErrHandling(disks);
            fuzz::require(isHandling == (firstLine == "1"), "only a first line \"1\" is error handling");
            fuzz::require(disks.isArray() && disks.size() == (isHandling ? 1U : 0U) &&
                              (!isHandling || disks[0] == "sda"),
                          "the list has the disk of the port");
        }
    }
    return 0;
}
