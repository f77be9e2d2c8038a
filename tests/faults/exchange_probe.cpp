// Asks the peer at the address in the argument once. The two calls of getppid() mark the exchange in a trace.

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
