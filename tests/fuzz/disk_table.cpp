// The disk table.
#include <algorithm>

#include "fuzz/fuzz.h"
#include "util.h"

int LLVMFuzzerInitialize(int* /*argc*/, char*** /*argv*/) {
    fuzz::prepareLog();
    return 0;
}

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::vector<std::string> devices = {"sda", "sdb", ""};
    fuzz::writeFile("/tmp/ha/info_hd.remote", fuzz::text(data, size));
    const std::vector<std::string> names = TERN::HA::Daemon::Util::devListToHumanReadable(devices);
    const auto isReadable = [](const std::string& name) {
        return name.rfind("Disk ", 0) == 0 || name.rfind("disk ", 0) == 0;
    };
    fuzz::require(names == devices || std::all_of(names.begin(), names.end(), isReadable),
                  "names are those of the table, or all devices stay as they are");
    fuzz::require(TERN::HA::Daemon::Util::devListToHumanReadable(devices) == names,
                  "a table is read the same again");
    return 0;
}
