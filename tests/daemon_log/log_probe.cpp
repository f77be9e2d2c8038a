#include <cstdlib>
#include <cstring>

namespace {

// Constructed before the log objects of this file, and so destroyed after them.
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

// Run under strace. The argument is a number of lines to log, "move" to move the buffered lines to
// disk, "rotate", or "end" to log while static objects are destroyed.
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
