#include "checker.h"

// Runs the reboot handler, under strace. Only ever run in a sandbox.
int main() {
    TERN::HA::Daemon::Status status;
    return TERN::HA::Daemon::RebootRemote().handle(status).empty() ? 0 : 1;
}
