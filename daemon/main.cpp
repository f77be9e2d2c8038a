#include <sys/stat.h>
#include <syslog.h>

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <string_view>

#include "check_config.h"
#include "daemon.h"
#include "directories.h"
#include "instance.h"
#include "journal.h"
#include "log_keeper.h"
#include "options.h"

namespace {

constexpr int FAILURE = 1;
constexpr int ALREADY_RUNNING = 3;

int run(const ternhad::Options& options) {
    ternhad::InstanceLock lock;
    switch (lock.take()) {
        case ternhad::InstanceLock::Result::taken:
            break;
        case ternhad::InstanceLock::Result::isRunning:
            std::cerr << "ternhad: already running as process " << lock.owner() << '\n';
            return ALREADY_RUNNING;
        case ternhad::InstanceLock::Result::failed:
            std::cerr << "ternhad: cannot take the lock in /run/ternha: " << std::strerror(errno) << '\n';
            return FAILURE;
    }
    if (!ternhad::prepareDirectories(options)) {
        return FAILURE;
    }
    ternhad::openStatusDirectory(options);
    return ternhad::Daemon(options, lock).run();
}

}  // namespace

int main(int argc, char** argv) try {
    umask(S_IRWXG | S_IRWXO);  // logs and control socket are private to this user
    if (argc == 3 && std::string_view(argv[1]) == ternhad::LOG_KEEPER) {
        return ternhad::keepLogs(std::strtoll(argv[2], nullptr, 10));
    }
    ternhad::Options options;
    if (const auto exitCode = ternhad::parseOptions(argc, argv, options)) {
        return *exitCode;
    }
    for (const std::string& warning : ternhad::warningsOf(options)) {
        ternhad::writeJournal(ternhad::Level::warning, warning);
    }
    if (options.isCheckOnly) {
        std::cout << ternhad::configurationText(options);
        return ternhad::isPrinted() ? EXIT_SUCCESS : FAILURE;
    }
    openlog("ternhad", LOG_PID, LOG_DAEMON);
    // The log keeper or the reader of standard error may exit at any time.
    (void)std::signal(SIGPIPE, SIG_IGN);
    return run(options);
} catch (const std::exception& error) {
    std::cerr << "ternhad: " << error.what() << '\n';
    return FAILURE;
}
