/// @file
/// The five questions to the peer, the checks of this node, and what is recorded of it.

#pragma once

#include <json/value.h>

#include <cstdio>
#include <map>
#include <string>

#include "env_check.h"
#include "status.h"

#pragma GCC visibility push(default)

namespace TERN::HA::Daemon {

// The five questions to the peer. All may be asked from any thread; each asking blocks up to 3 seconds for
// the answer (RebootRemote longer). Failures are logged, with the texts given here, and never thrown.

/// "is_alive": is the peer's daemon up and answering?
class IsRemoteAlive : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// True exactly when the answer is "alive". Stores and logs nothing: the caller hands the result to
    /// Status::setRemoteAlive.
    bool operator()() override;
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<IsRemoteAlive> reg;  ///< makes the question known when the library is loaded
};

/// "is_md_resync": is the peer resynchronising an md array?
class IsRemoteMDResync : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// True exactly when the answer is "resync". False also when there is no answer: "Failed to recv remote
    /// md resync responce".
    bool operator()() override;
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<IsRemoteMDResync> reg;  ///< makes the question known when the library is loaded
};

/// "is_disk_err_handling": is the peer handling disk errors, and on which disks?
///
/// The answer must fit the 63 bytes of a datagram: two disk names of usual length do, three do not. An answer
/// that was cut counts as one that cannot be parsed.
class IsRemoteDiskErrHandling : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// Returns the peer's flag and puts its list (array of device names; null when the answer has none) into
    /// `disks`; the two are independent. False with `disks` as it was when there is no answer ("Failed to
    /// recv remote disk error handling responce") or it is not a JSON object with a readable flag ("Failed to
    /// parse remote disk error info").
    bool operator()(Json::Value& disks) override;
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<IsRemoteDiskErrHandling>
        reg;  ///< makes the question known when the library is loaded
};

/// "reboot_remote": makes the peer reboot at once.
class RebootRemote : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// Asks the peer to reboot and follows it down: NodeRebootPending from the request on, then, when
    /// `status` no longer counts the peer as alive ("Remote offline") or after 30 tests one second apart,
    /// NodeRebooting. It does not clear the alive bit: another thread must do so through
    /// Status::setRemoteAlive. Always true, also when the request went unanswered, as it does when the peer
    /// obeys ("Failed to reboot remote, but keep checking"). Blocks up to 33 seconds.
    bool operator()(Status& status);

    /// Reboots this machine: moves both logs to disk, flushes the file systems and writes "b" to
    /// /proc/sysrq-trigger. Returns the empty string when that file cannot be written.
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<RebootRemote> reg;  ///< makes the question known when the library is loaded
};

/// "remote_hostname": what is the peer's own host name?
class GetRemoteHostname : public EnvCheck {
 public:
    using EnvCheck::operator();

    /// Puts the answer (up to 63 bytes, possibly empty, with the line end if the peer's name has one) into
    /// `hostname` and returns true; false when there is no answer: "Failed to get remote hostname". Do not
    /// use `hostname` then.
    bool operator()(std::string& hostname);
    std::string handle(Status& status) override;
    std::string getType() override;

    static CheckerRegister<GetRemoteHostname> reg;  ///< makes the question known when the library is loaded
};

// Local checks. They keep nothing between calls and may run on any thread.

/// True when any line of /proc/drbd holds one of the connection states in which both nodes are linked
/// ("Connected", the handshake, sync and verify states; a plain case-sensitive substring anywhere). With
/// several resources one that is connected suffices. False otherwise; "Failed to open /proc/drbd" when it
/// cannot be opened.
bool isDRBDConnect();

/// True when the sync_action of any md array reads exactly "resync" (recover, check and the like do not
/// count). Without md arrays: false and "Failed to set globBuf from /sys/block/md*".
bool isMDResync();

/// True when at least one disk is on an ATA port whose error handling runs. `disks` becomes the array of
/// those disks' device names, in the order of the sorted port paths (ata10 before ata2). Without ATA ports:
/// false, `disks` as it was, and "Failed to set globBuf from /sys/class/ata_port/ata*". A port whose disk has
/// no name counts for nothing: "Failed to get dev name by ata path: " and the port's path.
bool isDiskErrHandling(Json::Value& disks);

/// Puts the device name (at most 7 characters) of the disk on the ATA port whose path or name is `path` into
/// `name`; false with `name` as it was when the port has none. `path` may be modified.
bool devNameByAtaPath(char* path, std::string& name);

/// True exactly when the first line of the file at `path`, without its newline, equals `expected`. False and
/// "Failed to open sysfs file " with the path when it cannot be opened.
bool isSysfsValue(const std::string& path, const std::string& expected);

/// Runs a program and holds the stream of its output. One thread at a time.
class CommandPipe {
 public:
    /// Starts argv[0] with the null-terminated vector `argv`, without a shell. When that fails, or the vector
    /// is empty, _failed is set and the log has "Failed to exec command: " and the program's path.
    explicit CommandPipe(const char* const* argv);

    /// Closes the stream and waits for the program to end. Unless that exited with code 0 the log has "Failed
    /// to exec PATH return code: N", N being the raw wait status in decimal (256 for exit code 1).
    ~CommandPipe();

    CommandPipe(const CommandPipe&) = delete;
    CommandPipe& operator=(const CommandPipe&) = delete;

    FILE* _fp;     ///< the program's standard output, read by the owner with fgets; null when not started
    bool _failed;  ///< it could not be started
    std::string _command;  ///< its path, for messages
};

/// The average round trip to remoteIP("") in milliseconds, from three requests of /bin/ping. 0 when ping
/// cannot be started (two lines in the log) or printed no average. Blocks 0.4 seconds and the round trips, 10
/// seconds when nothing answers.
float heartbeatLatency();

/// The share of packets of the DRBD interface (drbdIF("")) that were not OK (errors, drops, overruns), from
/// sample to sample. An object belongs to one thread at a time.
class InterfaceChecker {
 public:
    /// Puts the share since the previous call, the first time since the counters began, into `rate` and
    /// returns true. 0 to 1 in normal operation; outside that when the counters went backwards. An interface
    /// that is not listed is no failure. False with `rate` as it was when /sbin/ifconfig cannot be run or
    /// printed nothing, lines too short or a counter out of range; the last line logged is then "Failed to
    /// get interface detail". Blocks until ifconfig ends.
    bool networkNonOkRate(float& rate);

 private:
    bool _interfaceDetail(const std::string& ifname, std::map<std::string, long long>& counters);
    float _rateGet(const std::map<std::string, long long>& counters);
    float _rateCaculate(long long nonOk, long long ok);

    long long _lastOkTotal = 0;
    long long _lastNonOkTotal = 0;
};

// Recording: each call adds one entry to the record log, which begins on the line after its time stamp. Any
// thread; failures go to the daemon log and leave no entry.

/// The record as compact JSON.
void recordStatus(Status& status);

/// Everything that argv[0], run with the null-terminated vector `argv`, writes to its standard output; an
/// entry is made also when that is nothing or the program fails. None when it cannot be started (two lines in
/// the daemon log). Blocks until the program ends, and holds its whole output in memory.
void recordCMD(const char* const* argv);

/// The process list, by /bin/ps.
void recordPS();

/// The usage of the file systems, by /bin/df.
void recordDF();

/// The content of /proc/meminfo; "Failed to get meminfo" when it cannot be opened.
void recordMemoryInfo();

/// This node's own host name, as it was before the cluster's shared name replaced it: the bytes of
/// /tmp/.ha.hostname.original, a trailing newline included; empty while that is missing or empty. A name once
/// read is kept for the life of the process. Thread-safe.
std::string getLocalHostname();

/// True when the cluster's tool reports a constraint on this node (it exits with status 0). Any thread;
/// blocks until the tool ends.
bool isHadConstraints();

}  // namespace TERN::HA::Daemon

#pragma GCC visibility pop
