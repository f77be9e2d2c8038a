#include "checker.h"

#include <libgen.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <new>
#include <optional>
#include <string_view>

#include "file.h"
#include "ha_log.h"
#include "interface_listing.h"
#include "json_text.h"
#include "path_glob.h"
#include "terncore.h"
#include "text.h"

namespace TERN::HA::Daemon {

namespace {

constexpr char ALIVE[] = "alive";
constexpr char RESYNC[] = "resync";
constexpr char NOT_RESYNC[] = "not_resync";
constexpr char DISK_ERR_FLAG[] = "isDiskErrHandling";
constexpr char DISK_ERR_LIST[] = "errHandlingDisk";

constexpr std::size_t HOSTNAME_LIMIT = 4096;

constexpr int REBOOT_ROUNDS = 30;  // a second each

const char* const PS_ARGV[] = {"/bin/ps", "-eo", "pid,ppid,stat,rss,cputime,args", nullptr};

// Counters come from a program's output: their sums and differences wrap around.
long long add(long long a, long long b) {
    return static_cast<long long>(static_cast<unsigned long long>(a) + static_cast<unsigned long long>(b));
}

long long subtract(long long a, long long b) {
    return static_cast<long long>(static_cast<unsigned long long>(a) - static_cast<unsigned long long>(b));
}

}  // namespace

// The registrations, in the order in which the checks are documented. This file comes last among
// the library's sources, so that every source file has its log objects by now.
CheckerRegister<IsRemoteAlive> IsRemoteAlive::reg(IsRemoteAlive().getType());
CheckerRegister<IsRemoteMDResync> IsRemoteMDResync::reg(IsRemoteMDResync().getType());
CheckerRegister<IsRemoteDiskErrHandling> IsRemoteDiskErrHandling::reg(IsRemoteDiskErrHandling().getType());
CheckerRegister<RebootRemote> RebootRemote::reg(RebootRemote().getType());
CheckerRegister<GetRemoteHostname> GetRemoteHostname::reg(GetRemoteHostname().getType());

// ---- Liveness ----

std::string IsRemoteAlive::getType() {
    return "is_alive";
}

std::string IsRemoteAlive::handle(Status&) {
    return ALIVE;
}

bool IsRemoteAlive::operator()() {
    std::string reply;
    return _sendToRemote(reply) && reply == ALIVE;
}

// ---- Hostname of the peer ----

std::string GetRemoteHostname::getType() {
    return "remote_hostname";
}

std::string GetRemoteHostname::handle(Status&) try {
    return getLocalHostname();
} catch (const std::bad_alloc&) {
    return "";
}

bool GetRemoteHostname::operator()(std::string& hostname) {
    if (!_sendToRemote(hostname)) {
        HA_LOG("Failed to get remote hostname");
        return false;
    }
    return true;
}

// ---- The peer's md resync ----

std::string IsRemoteMDResync::getType() {
    return "is_md_resync";
}

std::string IsRemoteMDResync::handle(Status& status) {
    return status.isMDResync ? RESYNC : NOT_RESYNC;
}

bool IsRemoteMDResync::operator()() {
    std::string reply;
    if (!_sendToRemote(reply)) {
        // Frozen: docs/compatibility.md#odd-spellings
        HA_LOG("Failed to recv remote md resync responce");
        return false;
    }
    return reply == RESYNC;
}

// ---- The peer's disk error handling ----

std::string IsRemoteDiskErrHandling::getType() {
    return "is_disk_err_handling";
}

std::string IsRemoteDiskErrHandling::handle(Status& status) try {
    Json::Value report(Json::objectValue);
    report[DISK_ERR_FLAG] = status.isDiskErrHandling.load();
    report[DISK_ERR_LIST] = status.getErrHandlingDisk();
    return jsonText(report);
} catch (const std::bad_alloc&) {
    return "";
} catch (const JsonOutOfMemory&) {
    return "";
}

bool IsRemoteDiskErrHandling::operator()(Json::Value& disks) try {
    std::string reply;
    if (!_sendToRemote(reply)) {
        HA_LOG("Failed to recv remote disk error handling responce");
        return false;
    }
    Json::Value report;
    const bool isJson = parseJson(reply, report);
    if (!report.isObject()) {
        report = Json::Value(Json::objectValue);  // other values have no members
    }
    const std::optional<bool> isHandling = readBool(report[DISK_ERR_FLAG]);
    if (!isJson || !isHandling) {
        HA_LOG("Failed to parse remote disk error info");
        return false;
    }
    disks = report[DISK_ERR_LIST];
    return *isHandling;
} catch (const std::bad_alloc&) {
    return false;
} catch (const JsonOutOfMemory&) {
    return false;
}

// ---- Reboot of the peer ----

std::string RebootRemote::getType() {
    return "reboot_remote";
}

std::string RebootRemote::handle(Status&) {
    try {
        daemonLog->writeLogToDisk();
        recordLog->writeLogToDisk();
    } catch (const std::bad_alloc&) {
        // A node that is out of memory must still reboot, if necessary without its logs.
    }
    sync();  // the kernel restarts without flushing or unmounting anything
    // Frozen: docs/compatibility.md#silent-trigger
    const File trigger("/proc/sysrq-trigger", O_WRONLY | O_CREAT | O_TRUNC);
    if (trigger.isOpen()) {
        trigger.write("b", 1);
    }
    return "";
}

bool RebootRemote::operator()(Status& status) {
    std::string ignored;
    if (!_sendToRemote(ignored)) {
        HA_LOG("Failed to reboot remote, but keep checking");
    }
    status.addRemoteNodeState(NodeRebootPending);
    // Frozen: docs/compatibility.md#no-test-after-last-sleep
    for (int round = 0; round < REBOOT_ROUNDS; ++round) {
        if (!status.isRemoteAlive()) {
            HA_LOG("Remote offline");
            break;
        }
        sleep(1);
    }
    // Frozen: docs/compatibility.md#reboot-always-succeeds
    status.addRemoteNodeState(NodeRebooting);
    status.delRemoteNodeState(NodeRebootPending);
    return true;
}

// ---- DRBD ----

bool isDRBDConnect() try {
    // The connection states in which both nodes are linked. Other states contain none of these
    // words.
    static constexpr std::array<std::string_view, 13> LINKED = {
        "WFReportParams", "Connected",  "StartingSyncS", "StartingSyncT", "WFBitMapS",
        "WFBitMapT",      "WFSyncUUID", "SyncSource",    "SyncTarget",    "PausedSyncS",
        "PausedSyncT",    "VerifyS",    "VerifyT"};

    std::string text;
    if (!readFile("/proc/drbd", text)) {
        HA_LOG("Failed to open /proc/drbd");
        return false;
    }
    // Frozen: docs/compatibility.md#drbd-substring
    // No state contains a newline, so that splitting into lines is unnecessary.
    return std::any_of(LINKED.begin(), LINKED.end(), [&text](std::string_view word) {
        return memmem(text.data(), text.size(), word.data(), word.size()) != nullptr;
    });
} catch (const std::bad_alloc&) {
    return false;
}

// ---- md resync and ATA error handling ----

bool isSysfsValue(const std::string& path, const std::string& expected) try {
    std::string text;
    if (!readFile(path.c_str(), text)) {
        HA_LOG("Failed to open sysfs file " + path);
        return false;
    }
    return std::string_view(text).substr(0, text.find('\n')) == expected;
} catch (const std::bad_alloc&) {
    return false;
}

bool isMDResync() try {
    const PathGlob arrays("/sys/block/md*");
    if (!arrays.matched()) {
        HA_LOG("Failed to set globBuf from /sys/block/md*");
        return false;
    }
    return std::any_of(arrays.begin(), arrays.end(), [](const char* array) {
        // Frozen: docs/compatibility.md#only-resync-counts
        return isSysfsValue(std::string(array) + "/md/sync_action", RESYNC);
    });
} catch (const std::bad_alloc&) {
    return false;
}

bool isDiskErrHandling(Json::Value& disks) try {
    const PathGlob ports("/sys/class/ata_port/ata*");
    if (!ports.matched()) {
        HA_LOG("Failed to set globBuf from /sys/class/ata_port/ata*");
        return false;
    }
    disks = Json::Value(Json::arrayValue);
    for (char* const port : ports) {
        if (!isSysfsValue(std::string(port) + "/error_handling", "1")) {
            continue;
        }
        std::string name;
        if (devNameByAtaPath(port, name)) {
            disks.append(name);
        } else {
            // Frozen: docs/compatibility.md#unnamed-disk
            HA_LOG(std::string("Failed to get dev name by ata path: ") + port);
        }
    }
    return !disks.empty();
} catch (const std::bad_alloc&) {
    return false;
} catch (const JsonOutOfMemory&) {
    return false;
}

bool devNameByAtaPath(char* path, std::string& name) {
    std::array<char, 8> buffer = {};
    if (TERNDiskGetDevnamebyAtaPort(buffer.data(), static_cast<int>(buffer.size()), __xpg_basename(path)) ==
        -1) {
        return false;
    }
    name = buffer.data();
    return true;
}

// ---- External programs ----

CommandPipe::CommandPipe(const char* const* argv) : _fp(nullptr), _failed(false) {
    if (argv[0] != nullptr) {
        _command = argv[0];
        _fp = PLATPopenv(argv[0], "r", argv);
    }
    if (_fp == nullptr) {
        HA_LOG("Failed to exec command: " + _command);
        _failed = true;
    }
}

CommandPipe::~CommandPipe() {
    if (_fp == nullptr) {
        return;
    }
    const int status = PLATPclose(_fp);
    if (WIFEXITED(status) && WEXITSTATUS(status) == 0) {
        _fp = nullptr;
        return;
    }
    // Frozen: docs/compatibility.md#raw-wait-status
    HA_LOG("Failed to exec " + _command + " return code: " + std::to_string(status));
}

float heartbeatLatency() {
    const std::string peer = remoteIP("");
    const char* const argv[] = {"/bin/ping", peer.c_str(), "-c", "3", "-w", "10", "-i", "0.2", "-q", nullptr};
    Line line = {};
    const CommandPipe ping(static_cast<const char* const*>(argv));
    if (ping._failed) {
        // Frozen: docs/compatibility.md#ifconfig-text
        HA_LOG("Failed to exec ifconfig to get interface status");
        return 0.0F;
    }
    float average = 0.0F;
    while (!readLine(ping._fp, line).empty()) {
        if (std::sscanf(line.data(), "rtt min/avg/max/mdev = %*f/%f/%*f/%*f ms", &average) == 1) {
            break;
        }
    }
    return average;
}

// ---- Interface counters ----

bool InterfaceChecker::networkNonOkRate(float& rate) {
    std::map<std::string, long long> counters;
    const std::string ifname = drbdIF("");
    if (!_interfaceDetail(ifname, counters)) {
        HA_LOG("Failed to get interface detail");
        return false;
    }
    rate = _rateGet(counters);
    return true;
}

bool InterfaceChecker::_interfaceDetail(const std::string& ifname,
                                        std::map<std::string, long long>& counters) {
    const char* const argv[] = {"/sbin/ifconfig", "-s", nullptr};
    const CommandPipe ifconfig(static_cast<const char* const*>(argv));
    if (ifconfig._failed) {
        HA_LOG("Failed to exec ifconfig to get interface status");
        return false;
    }
    InterfaceListing listing = readInterfaceListing(ifconfig._fp, ifname);
    switch (listing.outcome) {
        case InterfaceListing::Outcome::READ:
            counters.swap(listing.counters);
            return true;
        case InterfaceListing::Outcome::NO_TITLE:
            HA_LOG("Failed to get title from ifconfig output");
            return false;
        case InterfaceListing::Outcome::OUT_OF_RANGE:
            HA_LOG("strtoll failed: " + listing.token);
            return false;
        case InterfaceListing::Outcome::LINE_TOO_SHORT:
            break;
    }
    return false;
}

float InterfaceChecker::_rateGet(const std::map<std::string, long long>& counters) {
    long long ok = 0;
    long long nonOk = 0;
    for (const auto& [name, value] : counters) {
        long long& total = name.find("OK") != std::string::npos ? ok : nonOk;
        total = add(total, value);
    }
    const float rate = _rateCaculate(subtract(nonOk, _lastNonOkTotal), subtract(ok, _lastOkTotal));
    _lastOkTotal = ok;
    _lastNonOkTotal = nonOk;
    return rate;
}

// Frozen: docs/compatibility.md#unclamped-rate
float InterfaceChecker::_rateCaculate(long long nonOk, long long ok) {
    const long long sum = add(nonOk, ok);
    return sum == 0 ? 0.0F : static_cast<float>(nonOk) / static_cast<float>(sum);
}

// ---- Recording ----

void recordStatus(Status& status) {
    // Frozen: docs/compatibility.md#leading-newline
    recordLog->set("\n" + jsonText(status.toJson()));
}

void recordCMD(const char* const* argv) {
    Line line = {};
    const CommandPipe command(argv);
    if (command._failed) {
        HA_LOG("Failed to exec ifconfig to get interface status");
        return;
    }
    std::string output;
    for (std::string_view piece; !(piece = readLine(command._fp, line)).empty();) {
        output += piece;
    }
    // Before the pipe closes: output precedes the log line on a failure.
    recordLog->set("\n" + output);
}

void recordPS() {
    recordCMD(static_cast<const char* const*>(PS_ARGV));
}

void recordDF() {
    const char* const argv[] = {"/bin/df", nullptr};
    recordCMD(static_cast<const char* const*>(argv));
}

void recordMemoryInfo() {
    std::string content;
    if (!readFile("/proc/meminfo", content)) {
        HA_LOG("Failed to get meminfo");
        return;
    }
    recordLog->set("\n" + content);
}

// ---- Host identity ----

// Frozen: docs/compatibility.md#hostname-line-end
std::string getLocalHostname() {
    static std::mutex mutex;
    static std::string cache;
    const std::lock_guard<std::mutex> lock(mutex);
    if (cache.empty()) {
        // The whole name or none, also when memory runs out.
        cache = readSmallFile("/tmp/.ha.hostname.original", HOSTNAME_LIMIT, Owner::trusted);
    }
    return cache;
}

bool isHadConstraints() {
    return PLATExec("/var/packages/FailoverPair/target/sbin/ternha", "--local-has-constraint",
                    static_cast<const char*>(nullptr), static_cast<const char*>(nullptr)) == 0;
}

}  // namespace TERN::HA::Daemon
