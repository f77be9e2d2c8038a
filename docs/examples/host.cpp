// A minimal host daemon: host LOCAL-IP REMOTE-IP INTERFACE SOCKET. Needs /tmp/ha and /var/log/ha.
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <csignal>
#include <thread>

#include "checker.h"
#include "control.h"
#include "ha_log.h"

using namespace TERN::HA::Daemon;

namespace {

void check(Status& status) {
    status.setRemoteAlive(
        IsRemoteAlive()());  // one missed probe declares it dead here: a real host probes again
    status.isRemoteMDResync = status.isRemoteAlive() && IsRemoteMDResync()();
    status.isMDResync = isMDResync();
    status.isDRBDConnect = isDRBDConnect();
    Json::Value disks(Json::arrayValue);
    status.isDiskErrHandling = isDiskErrHandling(disks);
    status.setErrHandlingDisk(disks);
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 5) {
        return 2;
    }
    umask(S_IRWXG | S_IRWXO);  // logs and control socket are private to this user
    openlog("host", LOG_PID, LOG_DAEMON);
    localIP(argv[1]);
    remoteIP(argv[2]);
    drbdIF(argv[3]);

    sigset_t stop;
    sigemptyset(&stop);
    sigaddset(&stop, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &stop, nullptr);  // threads inherit the mask: sigtimedwait() receives it

    Status status;
    MonitordSocket control(argv[4], 0);
    control.setStatus(&status);
    if (!control.serverBind()) {
        return 1;  // see the system log
    }
    std::thread([&status] {
        while (SocketServer()(status)) {
        }
        _exit(1);  // see the daemon log
    }).detach();
    std::thread([&control] {
        for (;;) {
            control.serverListen();
        }
    }).detach();
    std::thread([&status] {
        for (;; sleep(1)) {
            check(status);
        }
    }).detach();

    constexpr timespec LOG_INTERVAL = {10, 0};
    while (sigtimedwait(&stop, nullptr, &LOG_INTERVAL) != SIGTERM) {
        daemonLog->writeLogToDisk();
        if (daemonLog->size() > 1048576) {
            daemonLog->rotate();
        }
    }
    HA_LOG("Stopping");
    daemonLog->writeLogToDisk();
    _exit(0);  // immediately: running threads still use what a return would destroy
}
