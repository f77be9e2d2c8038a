// The key-value file with the hostname of the pair.
#include "fuzz/fuzz.h"
#include "util.h"

int LLVMFuzzerInitialize(int* /*argc*/, char*** /*argv*/) {
    fuzz::prepareLog();
    return 0;
}

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string content = fuzz::text(data, size);
    fuzz::writeFile("/usr/tern/etc/packages/FailoverPair/ha.conf", content);
    const std::string name = TERN::HA::Daemon::Util::getHAHostname();
    fuzz::require(name.size() <= 63, "a name has at most 63 characters");
    fuzz::require(name.find('\n') == std::string::npos, "a name is on one line");
    fuzz::require(content.find(name) != std::string::npos, "a name stands in the file");
    fuzz::require(name.empty() || content.find("ha_hostname") != std::string::npos, "a name has its key");
    return 0;
}
