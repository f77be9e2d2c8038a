// Logs the lines "lab line FIRST" to "lab line LAST": ternha-lab-tool FIRST LAST

#include <cstdlib>
#include <iostream>
#include <string>

#include "ha_log.h"

int main(int argc, char** argv) {
    if (argc != 3) {
        std::cerr << "usage: ternha-lab-tool FIRST LAST\n";
        return EXIT_FAILURE;
    }
    for (int number = std::stoi(argv[1]); number <= std::stoi(argv[2]); ++number) {
        TERN::HA::Daemon::daemonLog->set("lab line " + std::to_string(number));
    }
    return EXIT_SUCCESS;
}
