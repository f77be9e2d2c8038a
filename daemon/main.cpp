#include <sys/stat.h>
#include <syslog.h>

#include "directories.h"
#include "host.h"
#include "options.h"

int main(int argc, char** argv) {
    ternhad::Options options;
    if (const auto exitCode = ternhad::parseOptions(argc, argv, options)) {
        return *exitCode;
    }
    umask(S_IRWXG | S_IRWXO);  // logs and control socket are for this user alone
    openlog("ternhad", LOG_PID, LOG_DAEMON);
    if (!ternhad::prepareDirectories(options.socket.c_str())) {
        return 1;
    }
    return ternhad::Host(options).run();
}
