// Actions of the scenario on a node.
//
//   ternha-lab-tool log FIRST LAST      log the lines "lab line FIRST" to "lab line LAST"
//   ternha-lab-tool send ADDRESS TEXT   send the text to the peer port of the address

#include <cstdlib>
#include <iostream>
#include <string>

#include "chkstate.h"
#include "ha_log.h"

namespace {

int logLines(int first, int last) {
    for (int number = first; number <= last; ++number) {
        TERN::HA::Daemon::daemonLog->set("lab line " + std::to_string(number));
    }
    return EXIT_SUCCESS;
}

int send(const std::string& address, const std::string& text) {
    constexpr unsigned int UNUSED_TIMEOUT = 1;  // no answer is awaited
    HASocketCommClient client(address, UNUSED_TIMEOUT);
    return client.Send(text) == static_cast<int>(text.size()) ? EXIT_SUCCESS : EXIT_FAILURE;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc == 4 && std::string(argv[1]) == "log") {
        return logLines(std::stoi(argv[2]), std::stoi(argv[3]));
    }
    if (argc == 4 && std::string(argv[1]) == "send") {
        return send(argv[2], argv[3]);
    }
    std::cerr << "usage: ternha-lab-tool log FIRST LAST | send ADDRESS TEXT\n";
    return EXIT_FAILURE;
}
