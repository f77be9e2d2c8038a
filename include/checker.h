/// @file
/// The five peer checks, the local checks, diagnostic recording and host identity.

#pragma once

#include <json/value.h>

#include <cstdio>
#include <map>
#include <string>

#include "env_check.h"
#include "status.h"

#pragma GCC visibility push(default)

namespace TERN::HA::Daemon {

// The five peer checks. The requesting side (call operator) sends its request to remoteIP("") and
// blocks for up to 3 seconds for the reply, RebootRemote for longer. Failures are reported by the
// result and logged with the texts given here. Nothing throws, not even when memory runs out: the
// check fails. Thread-safe.

/// "is_alive": liveness probe.
class IsRemoteAlive : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// Probe the peer. Returns true exactly when the reply is "alive", false for any other reply
    /// and when none arrived. Logs nothing and stores nothing: the caller passes the result to
    /// Status::setRemoteAlive.
    bool operator()() override;

    /// Return "alive".
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<IsRemoteAlive> reg;  ///< registers the check when the library is loaded
};

/// "is_md_resync": whether the peer has an md resync in progress.
class IsRemoteMDResync : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// Return true exactly when the reply is "resync". Returns false for any other reply, and when
    /// none arrived, logging "Failed to recv remote md resync responce".
    bool operator()() override;

    /// Return "resync" when `status.isMDResync` is set, "not_resync" otherwise.
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<IsRemoteMDResync> reg;  ///< registers the check when the library is loaded
};

/// "is_disk_err_handling": whether the peer is handling disk errors, and on which disks.
///
/// The reply must fit in 63 bytes: two disk names such as "sda" fit, three do not. The requesting
/// side fails to parse a truncated reply.
class IsRemoteDiskErrHandling : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// Return the peer's flag and store its list, as sent, in `disks`.
    ///
    /// The flag and the list are independent of each other. A reply without the list sets `disks`
    /// to null, one without the flag returns false. Returns false with `disks` unchanged when no
    /// reply arrived ("Failed to recv remote disk error handling responce") and when the reply is
    /// not JSON or its flag cannot be read as a bool ("Failed to parse remote disk error info").
    bool operator()(Json::Value& disks) override;

    /// Return the flag and the list of `status` as compact JSON. Blocks for the lock of the list.
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<IsRemoteDiskErrHandling> reg;  ///< registers the check when the library is loaded
};

/// "reboot_remote": make the peer reboot without a shutdown.
class RebootRemote : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// Make the peer reboot and wait for it to be declared dead. Returns true.
    ///
    /// Logs "Failed to reboot remote, but keep checking" when no reply arrived, which is normal: a
    /// peer that reboots cannot reply. Then sets NodeRebootPending in `status` and checks up to 30
    /// times, a second apart, whether the peer is still alive; logs "Remote offline" when it is
    /// not. In either case NodeRebooting is then set and NodeRebootPending cleared. This function
    /// never clears NodeAlive: another thread must do so through Status::setRemoteAlive. Blocks for
    /// up to 33 seconds.
    bool operator()(Status& status);

    /// Reboot this machine: move both logs to disk, flush the file systems and write "b" to
    /// /proc/sysrq-trigger. Returns the empty string if the reboot does not happen, for
    /// example because that file cannot be written.
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<RebootRemote> reg;  ///< registers the check when the library is loaded
};

/// "remote_hostname": the peer's own hostname.
class GetRemoteHostname : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// Store the reply in `hostname`: 0 to 63 bytes as sent, possibly with a newline. Returns true
    /// on success; when no reply arrived, logs "Failed to get remote hostname" and returns false.
    bool operator()(std::string& hostname);

    /// Return getLocalHostname().
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<GetRemoteHostname> reg;  ///< registers the check when the library is loaded
};

// Local checks. They keep no state and never throw. Thread-safe. They block for as long as the
// kernel takes to read its files.

/// Return true when any line of /proc/drbd contains a connection state in which both nodes are
/// linked: "Connected" or a handshake, resync or verify state. The test is for a case-sensitive
/// substring; with several resources, one that is connected is enough. Logs "Failed to open
/// /proc/drbd" and returns false when that file cannot be opened.
bool isDRBDConnect();

/// Return true when the sync_action of any md array is exactly "resync"; recover, check and the
/// others do not count. Logs "Failed to set globBuf from /sys/block/md*" and returns false when
/// there is no md array. An array without that file logs the line of isSysfsValue and is skipped.
bool isMDResync();

/// Find the disks on ATA ports under error handling.
///
/// @param disks  becomes an array of their device names in the order of the sorted port paths
///               (ata10 before ata2); unchanged when there are no ATA ports
/// @return true when there is at least one such disk. Two kinds of port do not count: one whose
///         disk has no name logs "Failed to get dev name by ata path: " and the path; one without
///         the attribute error_handling logs the line of isSysfsValue. Without any ATA port, logs
///         "Failed to set globBuf from /sys/class/ata_port/ata*".
bool isDiskErrHandling(Json::Value& disks);

/// Store the device name (1 to 7 characters) of the disk on the ATA port `path` (a path or a bare
/// port name) in `name`. Returns false with `name` unchanged when the port has no disk. `path` may
/// be modified.
bool devNameByAtaPath(char* path, std::string& name);

/// Return true when the first line of the file at `path`, without its newline, equals `expected`.
/// Logs "Failed to open sysfs file " and the path, and returns false, when the file cannot be
/// opened.
bool isSysfsValue(const std::string& path, const std::string& expected);

/// A running program and the stream of its standard output. Not thread-safe: use an object from one
/// thread at a time.
class CommandPipe {
 public:
    /// Start argv[0] with the null-terminated argument vector `argv`, without a shell. On failure,
    /// and for an empty vector, sets _failed and logs "Failed to exec command: " and the program's
    /// path.
    explicit CommandPipe(const char* const* argv);

    /// Close the stream and wait for the program, without limit. Logs "Failed to exec PATH return
    /// code: N" unless it exited with code 0; N is the raw wait status in decimal (256 for exit
    /// code 1).
    ~CommandPipe();

    CommandPipe(const CommandPipe&) = delete;
    CommandPipe& operator=(const CommandPipe&) = delete;

    FILE* _fp;             ///< the program's standard output; null when it could not be started
    bool _failed;          ///< the program could not be started
    std::string _command;  ///< path of the program, for messages
};

/// Return the average round trip to remoteIP("") in milliseconds, measured by /bin/ping with three
/// requests. Returns 0 when ping could not be started or printed no average; the log has the reason
/// unless ping exited with code 0. Blocks for about 0.4 seconds and the round trips, for 10 seconds
/// when the peer does not reply. Thread-safe.
float heartbeatLatency();

/// Non-OK packet rate of the DRBD interface (drbdIF("")), from one sample to the next. Not
/// thread-safe: use an object from one thread at a time.
class InterfaceChecker {
 public:
    /// Sample the counters of /sbin/ifconfig.
    ///
    /// @param rate  receives the share of packets that were not OK (errors, drops, overruns) since
    ///              the previous sample; for the first sample, since the counters were reset. 0 to
    ///              1; outside this range when the counters went backwards. Unchanged on failure.
    /// @return true on success, also when the interface is not listed: the rate is then
    ///         meaningless. False, with "Failed to get interface detail" as the last line logged,
    ///         when ifconfig could not be started or printed nothing, a line too short, or a
    ///         counter out of range.
    ///
    /// Blocks until ifconfig ends.
    bool networkNonOkRate(float& rate);

 private:
    bool _interfaceDetail(const std::string& ifname, std::map<std::string, long long>& counters);
    float _rateGet(const std::map<std::string, long long>& counters);
    float _rateCaculate(long long nonOk, long long ok);

    long long _lastOkTotal = 0;
    long long _lastNonOkTotal = 0;
};

// Diagnostic recording: each call appends one entry to the record log, whose text begins on the
// line after the time stamp. A program that cannot be started and a file that cannot be opened log
// a line to the daemon log and record no entry. Thread-safe.

/// Record the status as compact JSON. Blocks for the locks of `status`, then as DaemonLog::set does.
void recordStatus(Status& status);

/// Run argv[0] with the null-terminated argument vector `argv` and record everything that it writes
/// to its standard output; empty output and a failing program are recorded, too. Blocks until the
/// program ends and holds its output in memory.
void recordCMD(const char* const* argv);

/// Record the process list (/bin/ps). Blocks as recordCMD does.
void recordPS();

/// Record the file-system usage (/bin/df). Blocks as recordCMD does, without limit on a dead
/// network file system.
void recordDF();

/// Record /proc/meminfo. Logs "Failed to get meminfo" when it cannot be opened.
void recordMemoryInfo();

/// Return this node's own hostname, before the HA package replaced it by the shared name: the
/// bytes of /tmp/.ha.hostname.original, at most 4096 and a trailing newline included. Returns the
/// empty string while that file is missing or empty, or is not a regular file of root or this
/// process's user; a symbolic link is not followed. A non-empty name is cached for the life of the
/// process. Thread-safe; blocks for the reading of a small file.
std::string getLocalHostname();

/// Return true when the appliance's program `ternha --local-has-constraint` exits with status 0: a
/// constraint holds on this node. Returns false otherwise, also when it cannot be started. Blocks
/// until it ends. Thread-safe.
bool isHadConstraints();

}  // namespace TERN::HA::Daemon

#pragma GCC visibility pop
