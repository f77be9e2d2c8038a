#pragma once

#include <atomic>
#include <chrono>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "support/descriptor.h"

namespace test {

/// A stub system log that collects what syslog(3) sends. It reads continuously, so that writers
/// never block.
class SystemLog {
 public:
    struct Entry {
        int priority = -1;  ///< facility and severity, as in LOG_USER | LOG_ERR
        std::string ident;  ///< name of the program, with "[PID]" when the writer asked for it
        std::string text;
    };

    /// `path` is the log socket; pass Node::path("/dev/log") to collect the log of a node.
    explicit SystemLog(const std::string& path = "/dev/log");
    SystemLog(const SystemLog&) = delete;
    SystemLog& operator=(const SystemLog&) = delete;
    ~SystemLog();

    /// Return all entries so far, including those of every completed syslog() call. A malformed
    /// entry has priority -1 and the whole datagram as text.
    std::vector<Entry> entries();

    /// Return the texts of entries().
    std::vector<std::string> texts();

    /// Wait for at least `count` entries; return whether they arrived.
    bool waitFor(std::size_t count, std::chrono::milliseconds deadline = std::chrono::seconds(10));

 private:
    std::string _path;
    Descriptor _socket;
    std::mutex _mutex;
    std::vector<Entry> _entries;
    std::atomic<bool> _isStopping{false};
    std::thread _receiver;
};

}  // namespace test
