#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <mutex>
#include <string>

#include "flag.h"
#include "status.h"

namespace ternhad {

// An entry of the queue.
struct Happening {
    enum class Kind {
        change,    // `flag` has changed to `value`
        trouble,   // `what` fails for lack of a local resource, with errno `error`
        recovery,  // `what` succeeds again
        message,   // a line for the daemon log
    };

    Kind kind = Kind::message;
    Flag flag = Flag::peerAlive;
    bool value = false;
    int error = 0;
    const char* file = "";
    int line = 0;
    const char* what = "";  // of a trouble or recovery; has static storage duration
    std::string text;       // of a message
    std::chrono::system_clock::time_point time;
};

// Queue of everything that is logged: each state transition is recorded here after it has been
// stored. Recording only adds an entry to a queue of fixed size; one thread writes the entries to
// the log and may block for as long as a disk does. Thread-safe.
class Events {
 public:
    Events() = default;
    Events(const Events&) = delete;
    Events& operator=(const Events&) = delete;

    // Neither block nor allocate. Entries that find the queue full are lost; their number is
    // logged.
    void changed(Flag flag, bool value) noexcept;
    void troubleBegan(const char* what, int error) noexcept;
    void troubleEnded(const char* what) noexcept;

    // Call it through TERNHAD_LOG, which passes its call site.
    void log(const char* file, int line, std::string text) noexcept;

    // Write entries to the log until end() is called and the queue is empty. Thread body.
    void run();
    void end() noexcept;

    // Wait until all entries so far are in the log, but not longer than `limit`.
    void waitUntilWritten(std::chrono::milliseconds limit);

 private:
    static constexpr std::size_t CAPACITY = 256;

    void push(Happening&& happening) noexcept;
    bool pop(Happening& happening, std::size_t& lost);
    void write(const Happening& happening);

    std::mutex _mutex;  // guards the queue; never held while blocking
    std::condition_variable _wakeUp;
    std::condition_variable _written;
    std::array<Happening, CAPACITY> _queue;
    std::size_t _first = 0;
    std::size_t _count = 0;
    std::size_t _lost = 0;
    bool _isWriting = false;
    bool _isEnding = false;

    // Status::setRemoteAlive logs a transition before it stores it. The daemon stores it first, in
    // its own record; this one, which nothing else reads, produces the log line.
    TERN::HA::Daemon::Status _logged;
};

}  // namespace ternhad

// Logs "file.cpp:LINE text" to the daemon log.
#define TERNHAD_LOG(events, text) (events).log(__FILE_NAME__, __LINE__, (text))
