#include <cstdlib>
#include <cstring>

namespace {

// Made before the log objects of this file, and so destroyed after all that they could be destroyed with.
struct LastWord {
    ~LastWord();
    bool isWanted = false;
};

LastWord lastWord;

}  // namespace

#include "ha_log.h"

LastWord::~LastWord() {
    if (isWanted) {
        TERN::HA::Daemon::daemonLog->set("last word");
    }
}

// To be watched from outside: logs as many lines as its argument says; with "move" moves the buffered lines,
// with "rotate" rotates, with "end" logs when its static objects are destroyed.
int main(int argc, char** argv) {
    const char* const action = argc > 1 ? argv[1] : "";
    TERN::HA::Daemon::DaemonLog log("/var/log/ha", "/probe.log");
    if (std::strcmp(action, "move") == 0) {
        log.writeLogToDisk();
    } else if (std::strcmp(action, "rotate") == 0) {
        log.rotate();
    } else if (std::strcmp(action, "end") == 0) {
        lastWord.isWanted = true;
    } else {
        for (int i = 0; i < std::atoi(action); ++i) {
            log.set("line");
        }
    }
    return 0;
}
