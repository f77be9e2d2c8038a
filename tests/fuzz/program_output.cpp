// Output of ifconfig and ping. The first byte selects the program.
#include <cmath>

#include "checker.h"
#include "fuzz/fuzz.h"

int LLVMFuzzerInitialize(int* /*argc*/, char*** /*argv*/) {
    fuzz::prepareLog();
    drbdIF("eth1");
    remoteIP("127.0.0.2");
    return 0;
}

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace TERN::HA::Daemon;
    if (size == 0) {
        return 0;
    }
    const std::string output = fuzz::text(data + 1, size - 1);
    fuzz::programsPrint(output);
    if (data[0] % 2 == 0) {
        const float latency = heartbeatLatency();
        // Any whitespace may surround its words.
        fuzz::require(latency == 0.0F || output.find("min/avg/max/mdev") != std::string::npos,
                      "a latency comes from ping's summary");
        return 0;
    }
    InterfaceChecker checker;
    float rate = -1;
    const bool isKnown = checker.networkNonOkRate(rate);
    fuzz::require(isKnown || rate == -1.0F, "a rate that is not known stays unchanged");
    fuzz::require(!isKnown || !std::isnan(rate), "a rate that is known is a number");
    fuzz::require(!isKnown || rate == 0.0F || output.rfind("Iface", 0) == 0,
                  "a rate other than 0 has a title to it");
    const bool isKnownAgain = checker.networkNonOkRate(rate);
    fuzz::require(isKnown == isKnownAgain, "the same output can be read again");
    fuzz::require(!isKnownAgain || rate == 0.0F, "without a new packet the rate is 0");
    return 0;
}
