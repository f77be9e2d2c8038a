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

// Something that happened.
struct Happening {
    enum class Kind {
        change,    // `flag` has become `value`
        trouble,   // `text` cannot be done for lack of this node's own means, `error` being the reason
        recovery,  // ... and can be done again
        message,   // a line for the daemon log
    };

    Kind kind = Kind::message;
    Flag flag = Flag::peerAlive;
    bool value = false;
    int error = 0;
    const char* file = "";
    int line = 0;
    const char* what = "";  // of a trouble; with static storage duration
    std::string text;       // of a message
    std::chrono::system_clock::time_point time;
};

// The trace of what happens: every change of state passes through here, after the state has changed.
// Recording only puts a note into a queue of fixed size; one thread writes the notes down and may be stuck in
// that for as long as a disk is. Thread-safe.
class Events {
 public:
    Events() = default;
    Events(const Events&) = delete;
    Events& operator=(const Events&) = delete;

    // Neither block nor allocate. What finds the queue full is lost; how much was lost is logged.
    void changed(Flag flag, bool value) noexcept;
    void troubleBegan(const char* what, int error) noexcept;
    void troubleEnded(const char* what) noexcept;

    // Use TERNHAD_LOG: it passes the place of its call.
    void log(const char* file, int line, std::string text) noexcept;

    // Writes down what is recorded, until end() is called and the queue is empty. Body of one thread.
    void run();
    void end() noexcept;

 private:
    static constexpr std::size_t CAPACITY = 256;

    void push(Happening&& happening) noexcept;
    bool pop(Happening& happening, std::size_t& lost);
    void write(const Happening& happening);

    std::mutex _mutex;  // guards the queue; nothing is waited for under it
    std::condition_variable _wakeUp;
    std::array<Happening, CAPACITY> _queue;
    std::size_t _first = 0;
    std::size_t _count = 0;
    std::size_t _lost = 0;
    bool _isEnding = false;

    // Its own operation logs a change of the peer's life before it stores it. The daemon's record is changed
    // at once; this one, which nobody else reads, gives the line.
    TERN::HA::Daemon::Status _logged;
};

}  // namespace ternhad

// Logs "file.cpp:LINE text" to the daemon log.
#define TERNHAD_LOG(events, text) (events).log(__FILE_NAME__, __LINE__, (text))
