#pragma once

#include <atomic>
#include <chrono>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "support/descriptor.h"

namespace test {

/// Stands in for the system log: receives what syslog(3) sends. Datagrams are taken off the socket at once,
/// so that no writer is ever held up.
class SystemLog {
 public:
    struct Entry {
        int priority = -1;  ///< facility and severity, as in LOG_USER | LOG_ERR
        std::string ident;  ///< name of the program, with "[PID]" when the writer asked for it
        std::string text;
    };

    /// `path` is the log socket; Node::path("/dev/log") makes it the log of a node.
    explicit SystemLog(const std::string& path = "/dev/log");
    SystemLog(const SystemLog&) = delete;
    SystemLog& operator=(const SystemLog&) = delete;
    ~SystemLog();

    /// All entries up to now. What a syslog() call sent before this call is among them. An entry that does
    /// not have the form that syslog(3) gives it has priority -1 and its whole datagram as text.
    std::vector<Entry> entries();

    /// The texts of entries().
    std::vector<std::string> texts();

    /// Waits until there are at least `count` entries; returns whether there are.
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
