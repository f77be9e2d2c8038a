/// @file
/// The log.

#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#pragma GCC visibility push(default)

namespace TERN::HA::Daemon {

/// A log that survives a crash of its process: each line goes at once to a small buffer file under /tmp/ha,
/// moves from there to the persistent log when the host says so, and is archived with /bin/xz.
///
/// A line in both files: local time with zone, one space, the text, a newline, as in
///   2026-11-15T09:23:41+01:00 util.cpp:88 Failed to get ha hostname
///
/// No operation reports a failure or throws for trouble with files: a log has nowhere to report to. The host
/// provides both directories; nothing here makes them.
///
/// Thread-safe. Operations on one object run one after another. Each waits up to 60 seconds for the object's
/// mutex and then goes ahead without it, so that a stuck holder delays logging but never stops it. Separate
/// objects, and separate processes, may share their files: each line is one append.
class DaemonLog {
 public:
    /// The persistent log is `directory` + `fileName`, the buffer "/tmp/ha" + `fileName`: the file name
    /// brings its leading "/", the directory has no trailing one. Opens nothing.
    DaemonLog(std::string directory, std::string fileName);

    DaemonLog(const DaemonLog&) = delete;
    DaemonLog& operator=(const DaemonLog&) = delete;

    /// Appends time stamp, space, `text` (any length, any bytes) and newline to the buffer file with one
    /// open, one write and one close. The line is dropped when the buffer file cannot be opened. The stamp
    /// follows a change of TZ at once, one of the machine's time zone with the next second.
    void set(const std::string& text);

    /// Moves the buffered lines to the end of the persistent log, a write per line, and leaves the buffer
    /// file empty (made when missing). A last line without a newline gains one, after a tenth of a second in
    /// which its end may still come. The buffer is emptied also when the persistent log cannot be opened or
    /// written: those lines are lost, so that the buffer never grows without bound. A line that another
    /// object appends between the last read and the truncation is lost too.
    void writeLogToDisk();

    /// Compresses the persistent log and every uncompressed archive (log + ".0" to ".39"), then moves each
    /// archive (".N.xz") one number up and the log to ".0.xz". The former archive 39 is lost; a missing
    /// archive leaves a gap that moves along. Afterwards the persistent log does not exist until the next
    /// writeLogToDisk. Blocks while /bin/xz runs.
    void rotate();

    /// Size of the persistent log in bytes; 0 when it is missing or cannot be looked at. Does not lock.
    std::int64_t size() const;

 private:
    std::string _formatedTime() const;
    bool _xz(const std::string& path) const;                             ///< true when it failed
    bool _rename(const std::string& from, const std::string& to) const;  ///< true when it failed

    std::string _logPath;
    std::string _bufferPath;
    std::vector<std::string> _rotateFiles;  ///< the log itself, then its archives 0 to 39, all without ".xz"
    std::timed_mutex _mutex;
    std::int32_t _lockTimeout;  ///< seconds
};

}  // namespace TERN::HA::Daemon

#pragma GCC visibility pop
