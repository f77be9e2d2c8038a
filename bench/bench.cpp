// Operations of the library beside their baselines, and their growth. script/bench runs this in a
// sandbox and prints the table.
#include <arpa/inet.h>
#include <benchmark/benchmark.h>
#include <json/json.h>
#include <sched.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "baselines.h"
#include "checker.h"
#include "control.h"
#include "daemon_log.h"
#include "status.h"
#include "util.h"

namespace {

using namespace TERN::HA::Daemon;

constexpr int DISKS = 24;
constexpr char CONTROL_PATH[] = "/tmp/control.sock";
constexpr char BASELINE_CONTROL_PATH[] = "/tmp/baseline.sock";
constexpr int BASELINE_PORT = 7500;
constexpr char DISK_TABLE[] = "/tmp/ha/info_hd.remote";

void write(const std::string& path, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream(path) << text;
}

Status& status() {
    static Status instance;
    return instance;
}

// Formatted like replies of the control socket.
std::string textOf(Status& record) {
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
    Json::FastWriter writer;
#pragma GCC diagnostic pop
    writer.omitEndingLineFeed();
    return writer.write(record.toJson());
}

Json::Value diskNames(int count) {
    Json::Value names(Json::arrayValue);
    for (int i = 0; i < count; ++i) {
        names.append("sd" + std::string(1, static_cast<char>('a' + i)));
    }
    return names;
}

std::string diskTable(int members) {
    Json::Value table;
    for (int i = 0; i < members; ++i) {
        Json::Value& disk = table["1-" + std::to_string(i)];
        disk["HD_DEVNAME"] = "sd" + std::to_string(i);
        disk["HD_CONTAINER"] = "EXP1";
    }
    return table.toStyledString();
}

std::vector<std::string> tableDisks(int count) {
    std::vector<std::string> disks;
    for (int i = 0; i < count; ++i) {
        disks.push_back("sd" + std::to_string(i));
    }
    return disks;
}

DaemonLog& benchLog() {
    static DaemonLog log("/var/log/ha", "/bench.log");
    return log;
}

const std::string LINE_TEXT(100, 'x');
const std::string STAMPED_LINE = "2026-11-15T09:23:41+01:00 " + LINE_TEXT + "\n";

// Pin both ends of an exchange to different processors: sharing one, by chance, is eight times
// faster.
void stayOn(std::size_t processor) {
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(processor, &set);
    sched_setaffinity(0, sizeof set, &set);
}

void stayAnywhere() {
    cpu_set_t set;
    std::memset(&set, 0xff, sizeof set);
    sched_setaffinity(0, sizeof set, &set);
}

// Never freed.
void inBackground(std::function<void()> pass) {
    std::thread([pass = std::move(pass)] {
        stayOn(1);
        for (;;) {
            pass();
        }
    }).detach();
}

struct Operation {
    std::string name;
    std::function<void()> prepare;  // once
    std::function<void()> library;
    std::function<void()> baseline;
    std::function<void()> beforeEach = {};  // not timed
};

std::vector<Operation> operations() {
    std::vector<Operation> all;
    all.push_back({"DaemonLog::set, 100 bytes", [] { std::filesystem::remove("/tmp/ha/bench.log"); },
                   [] { benchLog().set(LINE_TEXT); },
                   [] { baseline::appendLine("/tmp/ha/baseline.log", STAMPED_LINE); }});

    const auto fill = [] {
        std::string lines;
        for (int i = 0; i < 10000; ++i) {
            lines += STAMPED_LINE;
        }
        for (const char* file : {"/tmp/ha/bench.log", "/tmp/ha/baseline.log"}) {
            write(file, lines);
        }
        for (const char* file : {"/var/log/ha/bench.log", "/var/log/ha/baseline.log"}) {
            write(file, "");
        }
    };
    all.push_back({"writeLogToDisk, 10,000 lines", [] {}, [] { benchLog().writeLogToDisk(); },
                   [] { baseline::moveLines("/tmp/ha/baseline.log", "/var/log/ha/baseline.log"); }, fill});

    all.push_back({"exchange with the peer",
                   [] {
                       localIP("127.0.0.1");
                       remoteIP("127.0.0.1");
                       inBackground([] { SocketServer()(status()); });
                       inBackground([socket = baseline::peerSocket(BASELINE_PORT)] {
                           baseline::answerPeer(socket, "alive");
                       });
                       while (!IsRemoteAlive()()) {
                       }
                   },
                   [] { IsRemoteAlive()(); }, [] { baseline::askPeer(BASELINE_PORT, "is_alive"); }});

    all.push_back({"control query I, ten disks",
                   [] {
                       status().setErrHandlingDisk(diskNames(10));
                       static MonitordSocket server(CONTROL_PATH, 0);
                       server.setStatus(&status());
                       if (!server.serverBind()) {
                           std::abort();
                       }
                       inBackground([] { server.serverListen(); });
                       inBackground([socket = baseline::controlSocket(BASELINE_CONTROL_PATH),
                                     reply = textOf(status())] { baseline::answerControl(socket, reply); });
                   },
                   [] {
                       Json::Value reply;
                       if (!MonitordSocket(CONTROL_PATH, 5).getServerData(reply)) {
                           std::abort();
                       }
                   },
                   [] { baseline::askControl(BASELINE_CONTROL_PATH, R"({"act":"I"})"); }});

    static const std::vector<std::string> WORDS = {
        "WFReportParams", "Connected",  "StartingSyncS", "StartingSyncT", "WFBitMapS",
        "WFBitMapT",      "WFSyncUUID", "SyncSource",    "SyncTarget",    "PausedSyncS",
        "PausedSyncT",    "VerifyS",    "VerifyT"};
    all.push_back({"isDRBDConnect, 1,000 lines",
                   [] {
                       std::string text;
                       for (int i = 0; i < 1000; ++i) {
                           text += " 0: cs:StandAlone ro:Primary/Unknown ds:UpToDate/DUnknown r-----\n";
                       }
                       write("/proc/drbd", text);
                   },
                   [] { benchmark::DoNotOptimize(isDRBDConnect()); },
                   [] { benchmark::DoNotOptimize(baseline::containsAny("/proc/drbd", WORDS)); }});

    all.push_back({"isMDResync, 24 arrays",
                   [] {
                       for (int i = 0; i < DISKS; ++i) {
                           write("/sys/block/md" + std::to_string(i) + "/md/sync_action", "idle\n");
                       }
                   },
                   [] { benchmark::DoNotOptimize(isMDResync()); },
                   [] { baseline::readEach("/sys/block/md*", "/md/sync_action"); }});

    all.push_back({"isDiskErrHandling, 24 ports",
                   [] {
                       for (int i = 0; i < DISKS; ++i) {
                           write("/sys/class/ata_port/ata" + std::to_string(i) + "/error_handling", "0\n");
                       }
                   },
                   [] {
                       Json::Value disks;
                       benchmark::DoNotOptimize(isDiskErrHandling(disks));
                   },
                   [] { baseline::readEach("/sys/class/ata_port/ata*", "/error_handling"); }});

    all.push_back({"CommandPipe, /bin/true", [] {},
                   [] {
                       const char* const argv[] = {"/bin/true", nullptr};
                       const CommandPipe pipe(argv);
                   },
                   baseline::runTrue});

    all.push_back({"devListToHumanReadable, 24 disks", [] { write(DISK_TABLE, diskTable(DISKS)); },
                   [disks = tableDisks(DISKS)] {
                       if (Util::devListToHumanReadable(disks).size() != DISKS) {
                           std::abort();
                       }
                   },
                   [] {
                       Json::Value table;
                       Json::CharReaderBuilder builder;
                       const std::string text = baseline::readAll(DISK_TABLE);
                       const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
                       if (!reader->parse(text.data(), text.data() + text.size(), &table, nullptr)) {
                           std::abort();
                       }
                   }});

    for (const int disks : {0, 10}) {
        const auto own = std::make_shared<Status>();
        own->setErrHandlingDisk(diskNames(disks));
        all.push_back({"Status::toJson to text, " + std::to_string(disks) + " disks",
                       [] {},
                       [own] { benchmark::DoNotOptimize(textOf(*own)); },
                       {}});
    }
    return all;
}

void measure(benchmark::State& state, const Operation& operation, const std::function<void()>& side) {
    using Clock = std::chrono::steady_clock;
    stayOn(0);
    if (!operation.beforeEach) {
        for ([[maybe_unused]] const auto pass : state) {
            side();
        }
        return;
    }
    for ([[maybe_unused]] const auto pass : state) {
        operation.beforeEach();
        const auto start = Clock::now();
        side();
        state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    }
}

// Measure toJson while `writers` threads modify the record.
void measureContention(benchmark::State& state) {
    stayAnywhere();
    std::atomic<bool> isOver{false};
    std::vector<std::thread> writers;
    for (std::int64_t i = 0; i < state.range(0); ++i) {
        writers.emplace_back([&isOver] {
            const Json::Value disks = diskNames(10);
            while (!isOver) {
                status().setErrHandlingDisk(disks);
                status().setErrHandlingDiskRemote(disks);
                status().isMDResync = !status().isMDResync;
            }
        });
    }
    for ([[maybe_unused]] const auto pass : state) {
        benchmark::DoNotOptimize(status().toJson());
    }
    isOver = true;
    for (std::thread& writer : writers) {
        writer.join();
    }
}

void growSet(benchmark::State& state) {
    write("/tmp/ha/bench.log", "");
    std::filesystem::resize_file("/tmp/ha/bench.log", static_cast<std::uintmax_t>(state.range(0)));
    for ([[maybe_unused]] const auto pass : state) {
        benchLog().set(LINE_TEXT);
    }
}

// A queued request, one server pass, and the reply.
void growPass(benchmark::State& state) {
    localIP("127.0.0.1");
    auto& registry = *CheckerFactory::opMap;
    while (registry.size() < static_cast<std::size_t>(state.range(0))) {
        registry.emplace("check" + std::to_string(registry.size()), &createEnvCheckT<IsRemoteAlive>);
    }
    const int client = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(7499);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    const auto ask = [&] {
        sendto(client, "is_alive", 8, 0, reinterpret_cast<const sockaddr*>(&address), sizeof address);
    };
    // The first pass binds the socket; earlier requests are lost.
    std::atomic<bool> isBound{false};
    std::thread first([&] {
        while (!isBound) {
            ask();
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        }
    });
    SocketServer()(status());
    isBound = true;
    first.join();
    for ([[maybe_unused]] const auto pass : state) {
        ask();
        SocketServer()(status());
        char answer[8];
        recv(client, answer, sizeof answer, 0);
    }
    close(client);
}

void growNames(benchmark::State& state) {
    const int count = static_cast<int>(state.range(0));
    write(DISK_TABLE, diskTable(count));
    const std::vector<std::string> disks = tableDisks(count);
    for ([[maybe_unused]] const auto pass : state) {
        benchmark::DoNotOptimize(Util::devListToHumanReadable(disks));
    }
}

// Run an operation `count` times, under strace.
int carryOut(const std::string& name, const std::string& side, int count) {
    for (const Operation& operation : operations()) {
        if (operation.name == name) {
            operation.prepare();
            for (int i = 0; i < count; ++i) {
                (side == "library" ? operation.library : operation.baseline)();
            }
            _exit(0);
        }
    }
    return 2;
}

}  // namespace

int main(int argc, char** argv) {
    std::filesystem::create_directories("/tmp/ha");
    std::filesystem::create_directories("/var/log/ha");
    if (argc == 5 && std::strcmp(argv[1], "--carry-out") == 0) {
        return carryOut(argv[2], argv[3], std::atoi(argv[4]));
    }

    static const std::vector<Operation> all = operations();
    for (const Operation& operation : all) {
        for (const auto* side : {&operation.library, &operation.baseline}) {
            if (!*side) {
                continue;
            }
            const std::string suffix = side == &operation.library ? "|library" : "|baseline";
            auto* const registered = benchmark::RegisterBenchmark(
                ("operation|" + operation.name + suffix).c_str(),
                [&operation, side](benchmark::State& state) {
                    static std::vector<const Operation*> prepared;
                    if (std::find(prepared.begin(), prepared.end(), &operation) == prepared.end()) {
                        operation.prepare();
                        prepared.push_back(&operation);
                    }
                    measure(state, operation, *side);
                });
            if (operation.beforeEach) {
                registered->UseManualTime();
            } else {
                registered->UseRealTime();
            }
        }
    }
    benchmark::RegisterBenchmark("operation|toJson while threads write|", measureContention)
        ->Arg(1)
        ->Arg(8)
        ->UseRealTime();
    benchmark::RegisterBenchmark("growth|DaemonLog::set, bytes in the log|", growSet)
        ->Arg(0)
        ->Arg(1 << 20)
        ->Arg(100 << 20)
        ->UseRealTime();
    benchmark::RegisterBenchmark("growth|server pass, registered checks|", growPass)
        ->Arg(5)
        ->Arg(100)
        ->Arg(10000)
        ->UseRealTime();
    benchmark::RegisterBenchmark("growth|devListToHumanReadable, disks|", growNames)
        ->Arg(6)
        ->Arg(12)
        ->Arg(24)
        ->Arg(48)
        ->UseRealTime();

    benchmark::Initialize(&argc, argv);
    benchmark::RunSpecifiedBenchmarks();
    // Skip destructors: server threads are still running.
    std::fflush(stdout);
    _exit(0);
}
