// Runs two nodes for a long time: with random events, datagram loss, or repeated link cuts.
// script/soak runs it in a sandbox.
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <array>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <future>
#include <random>
#include <sstream>
#include <stdexcept>

#include "support/sandbox_check.h"
#include "support/wait.h"
#include "ternhad/machine.h"

namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;
using test::Machine;

struct Options {
    double minutes = 1;
    unsigned int seed = 1;
    unsigned int loss = 0;  // percent of the datagrams that reach a node
    std::string events = "all";
    int cuts = 0;
    int idle = 0;
};

// A node and its true state.
struct Side {
    Side(const std::string& name, const std::string& own, const std::string& peer)
        : machine(name, own, peer) {}

    void start() {
        machine.daemon.emplace(machine.node.start({TERNHAD, "--local-ip", machine.address, "--remote-ip",
                                                   machine.peer, "--interface", "eth1", "--log-interval", "1",
                                                   "--snapshot-interval", "60", "--rotate-size", "65536"}));
        isRunning = true;
    }

    void setResync(bool on) {
        machine.write("/sys/block/md0/md/sync_action", on ? "resync\n" : "idle\n");
        isResync = on;
    }

    void setDisk(bool on) {
        machine.write("/sys/class/ata_port/ata3/error_handling", on ? "1\n" : "0\n");
        isDiskErrHandling = on;
    }

    // The daemon's directory in the /proc of this namespace.
    std::string proc() { return "/.kernel/proc/" + std::to_string(machine.daemon->pid()); }

    Machine machine;
    bool isRunning = false;
    bool isResync = false;
    bool isDiskErrHandling = false;
};

struct Figures {
    long descriptors = 0;
    long residentKilobytes = 0;
    long anonymousKilobytes = 0;
};

struct Usage {
    double cpuSeconds = 0;
    long wakeUps = 0;
};

// Return the number after `key` in a file of lines "key: number ...".
long valueOf(const std::string& path, const std::string& key) {
    std::ifstream file(path);
    std::string line;
    while (std::getline(file, line)) {
        if (line.rfind(key + ":", 0) == 0) {
            return std::stol(line.substr(key.size() + 1));
        }
    }
    return 0;
}

Figures figuresOf(Side& side) {
    Figures figures;
    const std::string proc = side.proc();
    for (const auto& entry : std::filesystem::directory_iterator(proc + "/fd")) {
        static_cast<void>(entry);
        ++figures.descriptors;
    }
    figures.residentKilobytes = valueOf(proc + "/status", "VmRSS");
    figures.anonymousKilobytes = valueOf(proc + "/status", "RssAnon");
    return figures;
}

// Resource use of the daemon's threads and, for processor time, its programs. The wake-ups of ended
// threads are unknown; each counts as one.
Usage usageOf(Side& side) {
    Usage usage;
    const std::string proc = side.proc();
    for (const auto& task : std::filesystem::directory_iterator(proc + "/task")) {
        usage.wakeUps += valueOf(task.path().string() + "/status", "voluntary_ctxt_switches");
    }
    const std::string text = test::readFile(proc + "/stat");
    std::istringstream columns(text.substr(text.rfind(')') + 2));
    std::string skipped;
    for (int i = 0; i < 11; ++i) {
        columns >> skipped;
    }
    long ticks = 0;
    for (int i = 0; i < 4; ++i) {  // its own user and system time, and those of its children
        long part = 0;
        columns >> part;
        ticks += part;
    }
    usage.cpuSeconds = static_cast<double>(ticks) / static_cast<double>(sysconf(_SC_CLK_TCK));
    return usage;
}

class Soak {
 public:
    explicit Soak(const Options& options) : _options(options), _random(options.seed) {
        test::connect(_a.machine.node, _a.machine.address, _b.machine.node, _b.machine.address);
        for (Side* side : {&_a, &_b}) {
            if (_options.loss > 0) {
                loseDatagrams(*side);
            }
            side->start();
        }
        expectTruth();
    }

    void runEvents() {
        const auto end = Clock::now() + std::chrono::duration<double, std::ratio<60>>(_options.minutes);
        const auto start = Clock::now();
        auto nextReport = start;
        while (Clock::now() < end) {
            if (Clock::now() >= nextReport) {
                report(Clock::now() - start);
                nextReport += 1min;
            }
            if (_options.events != "none") {
                happen();
                ++_events;
            }
            expectTruth();
            keepsTrueFor(std::chrono::milliseconds(uniform(0, 2000)));
        }
        report(Clock::now() - start);
        std::printf("%d events, no wrong state.\n", _events);
    }

    // Return the seconds from a cut of the link until a node declares the other dead.
    void runCuts() {
        std::vector<double> seconds;
        for (int i = 0; i < _options.cuts; ++i) {
            keepsTrueFor(std::chrono::milliseconds(uniform(1000, 2500)));
            const auto start = Clock::now();
            cut();
            std::array<bool, 2> isDead = {};
            require(
                test::eventually(30s,
                                 [&] {
                                     for (const std::size_t index : {0U, 1U}) {
                                         Side& side = index == 0 ? _a : _b;
                                         if (!isDead.at(index) && side.machine.sees("isRemoteAlive", false)) {
                                             isDead.at(index) = true;
                                             seconds.push_back(
                                                 std::chrono::duration<double>(Clock::now() - start).count());
                                         }
                                     }
                                     return isDead[0] && isDead[1];
                                 }),
                "a node does not see the cut");
            join();
            expectTruth();
        }
        std::sort(seconds.begin(), seconds.end());
        std::printf("%d cuts, seconds until a node says dead: minimum %.2f, median %.2f, maximum %.2f\n",
                    _options.cuts, seconds.front(), seconds[seconds.size() / 2], seconds.back());
    }

    // Print the resource use of an idle daemon.
    void runIdle() {
        const Usage before = usageOf(_a);
        std::this_thread::sleep_for(std::chrono::seconds(_options.idle));
        const Usage after = usageOf(_a);
        const Figures figures = figuresOf(_a);
        std::printf(
            "idle: %.2f CPU seconds per hour, %.1f wake-ups per second, %ld kB resident, %ld kB anonymous\n",
            (after.cpuSeconds - before.cpuSeconds) * 3600 / _options.idle,
            static_cast<double>(after.wakeUps - before.wakeUps) / _options.idle, figures.residentKilobytes,
            figures.anonymousKilobytes);
    }

    int deaths() {
        int count = 0;
        for (Side* side : {&_a, &_b}) {
            const std::string log = side->machine.log();
            for (std::size_t at = 0; (at = log.find("changed to dead", at)) != std::string::npos; ++at) {
                ++count;
            }
        }
        return count;
    }

    std::string logs() { return "node-a\n" + _a.machine.log() + "node-b\n" + _b.machine.log(); }

 private:
    static void require(bool holds, const std::string& what) {
        if (!holds) {
            throw std::runtime_error(what);
        }
    }

    int uniform(int from, int to) { return std::uniform_int_distribution<int>(from, to)(_random); }

    void loseDatagrams(Side& side) {
        const std::string lose = "numgen random mod 100 < " + std::to_string(_options.loss) + " drop; ";
        const auto nft = side.machine.node.run(
            {"nft", "table inet loss { chain input { type filter hook input priority 0; udp sport 7499 " +
                        lose + "udp dport 7499 " + lose + "}; }"});
        require(nft.exitCode == 0, "nft: " + nft.error);
    }

    void cut() {
        test::setLink(_a.machine.node, false);
        _isLinked = false;
    }

    void join() {
        test::setLink(_a.machine.node, true);
        _isLinked = true;
    }

    // Return the differences between the node's status and its true state.
    std::string wrong(Side& side, const Side& peer) {
        if (!side.isRunning) {
            return "";
        }
        const Json::Value status = side.machine.status();
        if (!status.isObject()) {
            return "no answer";
        }
        const auto differs = [&status](const char* flag, bool value) {
            return status[flag].asBool() != value;
        };
        if (differs("isMDResync", side.isResync) || differs("isDiskErrHandling", side.isDiskErrHandling) ||
            differs("isRemoteAlive", _isLinked && peer.isRunning)) {
            return status.toStyledString();
        }
        if (status["isRemoteAlive"].asBool() &&
            (differs("isRemoteMDResync", peer.isResync) ||
             differs("isRemoteDiskErrHandling", peer.isDiskErrHandling) ||
             (status["diskErrorHandlingDiskRemote"].size() == 1) != peer.isDiskErrHandling)) {
            return status.toStyledString();
        }
        return "";
    }

    bool isTrue() { return wrong(_a, _b).empty() && wrong(_b, _a).empty(); }

    void expectTruth() {
        require(test::eventually(_options.loss > 0 ? 120s : 20s, [this] { return isTrue(); }),
                "wrong for too long after " + _last + ":\n" + wrong(_a, _b) + wrong(_b, _a));
    }

    void keepsTrueFor(std::chrono::milliseconds time) {
        const auto end = Clock::now() + time;
        do {
            const std::string what = wrong(_a, _b) + wrong(_b, _a);
            require(what.empty(), "wrong again after " + _last + ":\n" + what);
            std::this_thread::sleep_for(50ms);
        } while (Clock::now() < end);
    }

    void happen() {
        Side& side = uniform(0, 1) == 0 ? _a : _b;
        switch (uniform(0, _options.events == "state" ? 1 : 8)) {
            case 0:
                _last = "a change of the resync";
                side.setResync(!side.isResync);
                break;
            case 1:
                _last = "a change of the disk errors";
                side.setDisk(!side.isDiskErrHandling);
                break;
            case 2:
                _last = "a cut link";
                cut();
                expectTruth();
                keepsTrueFor(1s);
                _last = "a joined link";
                join();
                break;
            case 3:
                _last = "a killed daemon";
                crash();
                expectTruth();
                _b.start();
                break;
            case 4:
                _last = "a daemon that stood still";
                side.machine.daemon->signal(SIGSTOP);
                std::this_thread::sleep_for(std::chrono::milliseconds(uniform(100, 8000)));
                side.machine.daemon->signal(SIGCONT);
                break;
            case 5:
                _last = "a hangup";
                side.machine.daemon->signal(SIGHUP);
                break;
            case 6:
                _last = "a burst of lines";
                for (int i = 0; i < 500; ++i) {
                    test::appendFile(side.machine.node.path("/tmp/ha/ha.daemon.log"),
                                     "2026-01-01T00:00:00+00:00 burst " + std::to_string(i) + "\n");
                }
                break;
            case 7:
                _last = "many clients";
                for (int i = 0; i < 200; ++i) {
                    require(side.machine.status().isObject(), "a client got no answer");
                }
                break;
            default:
                reboot();
                break;
        }
    }

    void crash() {
        _b.machine.daemon->signal(SIGKILL);
        require(_b.machine.daemon->waitFor(10s).has_value(), "the daemon does not die");
        _b.isRunning = false;
    }

    void reboot() {
        _last = "an ordered reboot";
        const std::string trigger = "/proc/sysrq-trigger";
        _b.machine.write(trigger, "");
        const std::string socket = _a.machine.node.path(test::CONTROL_SOCKET);
        auto order = std::async(std::launch::async, [&socket] {
            return TERN::HA::Daemon::MonitordSocket(socket, 60).rebootRemote();
        });
        const bool isPulled =
            test::eventually(20s, [&] { return test::readFile(_b.machine.node.path(trigger)) == "b"; });
        crash();
        require(order.get() && isPulled, "the reboot does not reach the peer");
        require(TERN::HA::Daemon::MonitordSocket(socket, 5).isRebootRemote(),
                "the peer does not count as rebooting");
        expectTruth();
        _b.start();
        expectTruth();
        require(!TERN::HA::Daemon::MonitordSocket(socket, 5).isRebootRemote(),
                "the peer counts as rebooting");
    }

    void report(Clock::duration elapsed) {
        const Figures a = figuresOf(_a);
        const Figures b = figuresOf(_b);
        std::printf("%5.1f min  %5d events  a: %ld descriptors, %ld kB  b: %ld descriptors, %ld kB\n",
                    std::chrono::duration<double, std::ratio<60>>(elapsed).count(), _events, a.descriptors,
                    a.residentKilobytes, b.descriptors, b.residentKilobytes);
        std::fflush(stdout);
    }

    const Options& _options;
    std::mt19937 _random;
    Side _a{"node-a", "10.0.0.1",
            "10.0.0.2"};  // its daemon is never started again: its figures must stay flat
    Side _b{"node-b", "10.0.0.2", "10.0.0.1"};
    bool _isLinked = true;
    int _events = 0;
    std::string _last = "the start";
};

}  // namespace

int main(int argc, char** argv) {
    test::requireSandbox();
    Options options;
    CLI::App app("Two nodes for a long time");
    app.add_option("--minutes", options.minutes, "how long")->check(CLI::PositiveNumber);
    app.add_option("--seed", options.seed, "of the events");
    app.add_option("--loss", options.loss, "percent of the datagrams that each node loses")
        ->check(CLI::Range(0, 50));
    app.add_option("--events", options.events,
                   "all; state: resyncs and disk errors only; none: nothing happens, and nobody may die")
        ->check(CLI::IsMember({"all", "state", "none"}));
    app.add_option("--cuts", options.cuts, "instead: cut the link so often, and measure");
    app.add_option("--idle", options.idle, "instead: leave both alone for so many seconds, and measure");
    CLI11_PARSE(app, argc, argv);

    Soak soak(options);
    try {
        if (options.idle > 0) {
            soak.runIdle();
            return 0;
        }
        if (options.cuts > 0) {
            soak.runCuts();
            return 0;
        }
        soak.runEvents();
        const int deaths = soak.deaths();
        if (options.events != "all" && deaths > 0) {
            throw std::runtime_error(std::to_string(deaths) + " false deaths");
        }
    } catch (const std::exception& error) {
        std::fprintf(stderr, "FAILED: %s\n%s", error.what(), soak.logs().c_str());
        return 1;
    }
    return 0;
}
