// A host daemon that is its own peer.
#include <env_check.h>
#include <status.h>

#include <iostream>
#include <thread>

#include "checker.h"

int main() {
    localIP("127.0.0.1");
    remoteIP("127.0.0.1");
    TERN::HA::Daemon::Status status;
    std::thread server([&] { SocketServer()(status); });
    while (!status.isRemoteAlive()) {
        status.setRemoteAlive(TERN::HA::Daemon::IsRemoteAlive()());
    }
    server.join();
    std::cout << std::boolalpha << status.toJson()["isRemoteAlive"].asBool() << '\n';
}
