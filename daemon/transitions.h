#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <mutex>
#include <optional>

#include "event.h"
#include "flag.h"

namespace ternhad {

// A state transition: a change of a flag. The first check, and the first after the flag was stale,
// change it from unknown.
struct Transition {
    Flag flag = Flag::peerAlive;
    std::optional<bool> old;
    bool value = false;
    std::chrono::system_clock::time_point time;
};

// Values of the flags, since when, and how often they changed; the latest transitions for their
// readers. Thread-safe.
class Transitions {
 public:
    using Time = std::chrono::system_clock::time_point;

    struct State {
        std::optional<bool> value;  // none before the first check
        Time since;
        Time checked;               // when a check last confirmed this value
        std::uint64_t changes = 0;  // after the first check
        bool isStale = false;       // the value is the last known one
    };

    // A flag that no check has confirmed for `staleAfter` is stale.
    explicit Transitions(Clock::duration staleAfter) : _staleAfter(staleAfter) {}

    Transitions(const Transitions&) = delete;
    Transitions& operator=(const Transitions&) = delete;

    // Record the result of a check of `flag`. Neither blocks nor allocates. Flags reported by the
    // peer are stale from the moment it is dead until it reports them again.
    void found(Flag flag, bool value) noexcept;

    State state(Flag flag) const noexcept;

    // Receives the transitions from its construction on. For one thread.
    class Reader {
     public:
        explicit Reader(Transitions& transitions);
        ~Reader();

        Reader(const Reader&) = delete;
        Reader& operator=(const Reader&) = delete;

        // Set when next() may return a transition.
        Event& event() noexcept { return _event; }

        // Return the next transition, or nothing. A reader that is too slow loses the oldest ones;
        // `lost` is set to their number.
        std::optional<Transition> next(std::uint64_t& lost) noexcept;

     private:
        friend class Transitions;

        Transitions& _transitions;
        Event _event;
        std::uint64_t _position;
    };

 private:
    static constexpr std::size_t CAPACITY = 256;
    static constexpr std::size_t MOST_READERS = 4;

    struct Entry {
        State state;
        Clock::time_point lastCheck;
        bool isConfirmed = false;  // since the peer was dead
    };

    bool isStale(Flag flag, const Entry& entry, Clock::time_point now) const noexcept;
    Entry& entryOf(Flag flag) noexcept { return _entries[static_cast<std::size_t>(flag)]; }

    mutable std::mutex _mutex;  // never held while blocking
    std::array<Entry, FLAGS> _entries;
    std::array<Transition, CAPACITY> _latest;
    std::uint64_t _count = 0;
    std::array<Reader*, MOST_READERS> _readers = {};
    Clock::duration _staleAfter;
};

}  // namespace ternhad
