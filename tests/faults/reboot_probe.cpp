#include "checker.h"

// Obeys an order to reboot, to be watched from outside. Only ever run in a sandbox.
int main() {
    TERN::HA::Daemon::Status status;
    return TERN::HA::Daemon::RebootRemote().handle(status).empty() ? 0 : 1;
}
