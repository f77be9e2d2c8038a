// ternhad's configuration file.
#include <arpa/inet.h>
#include <fcntl.h>
#include <unistd.h>

#include "fuzz/fuzz.h"
#include "options.h"

int LLVMFuzzerInitialize(int* /*argc*/, char*** /*argv*/) {
    fuzz::prepareLog();
    // Error messages would drown those of the fuzzer.
    dup2(open("/dev/null", O_WRONLY | O_CLOEXEC), STDOUT_FILENO);
    return 0;
}

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    constexpr char FILE_NAME[] = "/tmp/ternhad.conf";
    fuzz::writeFile(FILE_NAME, fuzz::text(data, size));
    const char* const argv[] = {"ternhad", "--config", FILE_NAME};
    ternhad::Options options;

    static const int errors = dup(STDERR_FILENO);
    static const int nowhere = open("/dev/null", O_WRONLY | O_CLOEXEC);
    dup2(nowhere, STDERR_FILENO);
    const std::optional<int> exitCode = ternhad::parseOptions(3, argv, options);
    dup2(errors, STDERR_FILENO);

    if (exitCode) {
        fuzz::require(*exitCode == 0 || *exitCode == 2, "a wrong file is wrong usage");
        return 0;
    }
    in_addr address = {};
    for (const std::string* ip : {&options.localIp, &options.remoteIp}) {
        fuzz::require(inet_pton(AF_INET, ip->c_str(), &address) == 1, "addresses are dotted quads");
    }
    fuzz::require(options.localIp != options.remoteIp, "the nodes have two addresses");
    fuzz::require(!options.interface.empty() && options.interface.size() < 16,
                  "the interface has a possible name");
    fuzz::require(options.socket[0] == '/' && options.socket.size() < 108, "the socket's path can be bound");
    for (const ternhad::Seconds interval :
         {options.checkInterval, options.heartbeatInterval, options.logInterval, options.snapshotInterval}) {
        fuzz::require(interval.count() >= 0.1 && interval.count() <= 86400, "intervals are in their range");
    }
    fuzz::require(options.rotateSize >= 4096, "a log is not rotated for nothing");
    return 0;
}
