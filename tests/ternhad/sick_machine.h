#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <fstream>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "support/udp.h"
#include "ternhad/daemon.h"

namespace test {

using namespace std::chrono_literals;

constexpr char BUFFER_FILE[] = "/tmp/ha/ha.daemon.log";
constexpr char LOG_FILE[] = "/var/log/ha/ha.daemon.log";
constexpr char TRIGGER[] = "/proc/sysrq-trigger";

// A peer at 127.0.0.2 that replies to everything for as long as it lives.
class Peer {
 public:
    Peer() : _thread([this] { run(); }) {}
    ~Peer() {
        _isOver = true;
        _thread.join();
    }

    // From now on it replies to liveness probes only.
    void beReticent() { _isReticent = true; }

    // It was ordered to reboot.
    bool isOrdered() const { return _isOrdered; }

    Peer(const Peer&) = delete;
    Peer& operator=(const Peer&) = delete;

 private:
    void run() {
        UdpSocket socket("127.0.0.2", 7499);
        while (!_isOver) {
            const auto request = socket.receive(10ms);
            _isOrdered = _isOrdered || (request && request->bytes == "reboot_remote");
            if (request && (!_isReticent || request->bytes == "is_alive")) {
                const std::string reply = request->bytes == "is_alive" ? "alive"
                                          : request->bytes == "is_disk_err_handling"
                                              ? R"({"errHandlingDisk":[],"isDiskErrHandling":false})"
                                              : "not_resync";
                socket.send(reply, request->address, request->port);
            }
        }
    }

    std::atomic<bool> _isOver{false};
    std::atomic<bool> _isReticent{false};
    std::atomic<bool> _isOrdered{false};
    std::thread _thread;
};

// Makes every open of this file for writing hang, as on a disk that hangs.
inline void hang(const char* file) {
    // In one step: the daemon would make the file again.
    const std::string fifo = std::string(file) + ".fifo";
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
    ASSERT_EQ(std::rename(fifo.c_str(), file), 0);
}

// The log keeper of a daemon; -1 while there is none.
inline pid_t childOf(pid_t process) {
    const std::string name = std::to_string(process);  // of the thread that starts log keepers, too
    std::ifstream children("/proc/" + name + "/task/" + name + "/children");
    pid_t child = -1;
    return children >> child ? child : -1;
}

// A daemon on 127.0.0.1, on a machine that gets sick while its peer at 127.0.0.2 is well.
class SickMachineTest : public ::testing::Test {
 protected:
    void SetUp() override {
        writeFile(TRIGGER, "");
        makeDirectories("/var/log/ha");
    }

    void start(const std::vector<std::string>& more = {}) {
        startAlone(more);
        ASSERT_TRUE(eventually(20s, [] { return isPeerAlive(); })) << daemon->error();
    }

    // Without waiting for the peer to be seen.
    void startAlone(const std::vector<std::string>& more = {}) {
        std::vector<std::string> command = prefix;
        const auto arguments = daemonArguments("127.0.0.1", "127.0.0.2", "lo", more);
        command.insert(command.end(), arguments.begin(), arguments.end());
        daemon.emplace(command);
    }

    static bool isPeerAlive() { return statusAt()["isRemoteAlive"].asBool(); }

    // What the journal shows.
    bool says(const std::string& text) const { return daemon->error().find(text) != std::string::npos; }

    // The daemon's replies to a request from another address of this machine.
    static bool replies(const std::string& request) {
        UdpSocket asker("127.0.0.4");
        asker.send(request, "127.0.0.1", 7499);
        return asker.receive(2s).has_value();
    }

    static void orderReboot() { UdpSocket("127.0.0.4").send("reboot_remote", "127.0.0.1", 7499); }

    static bool isRebooted() { return readFile(TRIGGER) == "b"; }

    // The limit is generous, for emulated processors: what hangs here would hang for a minute.
    void expectEndInTime(std::chrono::milliseconds limit = 5s) {
        const Stopwatch stopwatch;
        daemon->signal(SIGTERM);
        const auto status = daemon->waitFor(20s);
        ASSERT_TRUE(status.has_value());
        EXPECT_EQ(*status, 0) << daemon->error();
        EXPECT_LT(stopwatch.elapsed(), limit);
    }

    std::vector<std::string> prefix;  // of the daemon's command
    std::optional<Peer> peer{std::in_place};
    std::optional<Process> daemon;
};

}  // namespace test
