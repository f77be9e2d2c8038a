// Sends one liveness probe to the address in its argument. Calls of getppid() mark begin and end in
// a trace.

#include <unistd.h>

#include "checker.h"

int main(int, char** argv) {
    remoteIP(argv[1]);
    TERN::HA::Daemon::IsRemoteAlive isRemoteAlive;
    getppid();
    const bool isAlive = isRemoteAlive();
    getppid();
    _exit(isAlive ? 0 : 1);
}
