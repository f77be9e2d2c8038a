/// @file
/// Daemon log: buffered under /tmp/ha, persistent under the directory that the host chose.

#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#pragma GCC visibility push(default)

namespace TERN::HA::Daemon {

/// Log sink. set appends a line to a small buffer file under /tmp/ha, writeLogToDisk moves the
/// buffered lines to the persistent log, rotate compresses the persistent log and shifts its
/// archives. No line is kept in process memory, so a crash of the process loses none.
///
/// Format of a line in both files: local time with zone, one space, the text, a newline, as in
///   2026-11-15T09:23:41+01:00 util.cpp:88 Failed to get ha hostname
///
/// No operation reports I/O errors: a log sink has nowhere to report them. Running out of memory
/// throws std::bad_alloc. The host creates both directories.
///
/// Thread-safe. Operations on one object are serialised by its mutex, for which each waits up to 60
/// seconds and then proceeds without the lock: a hung holder delays logging but never stops it.
/// Several objects and processes may call set for the same files, because a line is one append.
/// Call writeLogToDisk and rotate for the same files from one place at a time: overlapping moves
/// lose or duplicate lines.
class DaemonLog {
 public:
    /// Construct a log whose persistent file is `directory` + `fileName` and whose buffer file is
    /// "/tmp/ha" + `fileName`. No separator is inserted: `fileName` begins with "/" and `directory`
    /// does not end with one. Opens nothing.
    DaemonLog(std::string directory, std::string fileName);

    DaemonLog(const DaemonLog&) = delete;
    DaemonLog& operator=(const DaemonLog&) = delete;

    /// Append time stamp, space, `text` (any length, any bytes) and newline to the buffer file: one
    /// open, one write, one close. Drops the line when the buffer file cannot be opened. The time
    /// stamp follows a change of TZ at once and a change of the machine's time zone from the next
    /// second on.
    void set(const std::string& text);

    /// Move the buffered lines to the end of the persistent log, one write per line, and truncate
    /// the buffer file, which is created when missing. An unterminated last line gets a newline if
    /// its writer has not completed it within 100 ms. The buffer is truncated even when the
    /// persistent log cannot be opened or written, so that it never grows without bound: those
    /// lines are lost, and so is a line that another object appends between the last read and the
    /// truncation.
    void writeLogToDisk();

    /// Compress the persistent log and every uncompressed archive with /bin/xz, then move each
    /// archive (".N.xz") one number up and the log to ".0.xz". Archive 38 replaces archive 39; a
    /// missing archive leaves a gap that moves up as well. The persistent log does not exist until
    /// the next writeLogToDisk. Results of compression and renaming are ignored. Blocks for up to
    /// 41 runs of /bin/xz.
    void rotate();

    /// Return the size of the persistent log in bytes, 0 when it is missing or inaccessible. Does
    /// not lock.
    std::int64_t size() const;

 private:
    std::string _formatedTime() const;
    // Frozen: docs/compatibility.md#inverted-results
    bool _xz(const std::string& path) const;                             ///< true when it failed
    bool _rename(const std::string& from, const std::string& to) const;  ///< true when it failed

    std::string _logPath;
    std::string _bufferPath;
    std::vector<std::string> _rotateFiles;  ///< the log, then archives 0 to 39, without ".xz"
    std::timed_mutex _mutex;
    std::int32_t _lockTimeout;  ///< seconds
};

}  // namespace TERN::HA::Daemon

#pragma GCC visibility pop
