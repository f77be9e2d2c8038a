#include <cstdlib>
#include <cstring>

#include "daemon_log.h"

// Logs as many lines as its argument says, or, with "move", moves the buffered lines; to be watched from
// outside.
int main(int argc, char** argv) {
    TERN::HA::Daemon::DaemonLog log("/var/log/ha", "/probe.log");
    if (argc > 1 && std::strcmp(argv[1], "move") == 0) {
        log.writeLogToDisk();
        return 0;
    }
    const int lines = argc > 1 ? std::atoi(argv[1]) : 0;
    for (int i = 0; i < lines; ++i) {
        log.set("line");
    }
    return 0;
}
