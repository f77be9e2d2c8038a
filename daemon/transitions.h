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

// A change of a flag. It changes from unknown by its first check, and by the first after it was stale.
struct Transition {
    Flag flag = Flag::peerAlive;
    std::optional<bool> old;
    bool value = false;
    std::chrono::system_clock::time_point time;
};

// What the flags are, since when, and how often they have changed; the latest changes for those who follow
// them. Thread-safe.
class Transitions {
 public:
    using Time = std::chrono::system_clock::time_point;

    struct State {
        std::optional<bool> value;  // none before the first check
        Time since;
        Time checked;               // when a check has found this value last
        std::uint64_t changes = 0;  // after the first check
        bool isStale = false;       // the value is the last known one
    };

    // A flag that no check has confirmed for `staleAfter` is stale.
    explicit Transitions(Clock::duration staleAfter) : _staleAfter(staleAfter) {}

    Transitions(const Transitions&) = delete;
    Transitions& operator=(const Transitions&) = delete;

    // Records what a check of `flag` found. Neither blocks nor allocates. What the peer reports is stale from
    // its death until it reports again.
    void found(Flag flag, bool value) noexcept;

    State state(Flag flag) const noexcept;

    // Follows the changes from its construction on. Belongs to one thread.
    class Reader {
     public:
        explicit Reader(Transitions& transitions);
        ~Reader();

        Reader(const Reader&) = delete;
        Reader& operator=(const Reader&) = delete;

        // Set when there may be more.
        Event& event() noexcept { return _event; }

        // The next change; nothing when there is none. A reader that is too slow loses the oldest ones:
        // `lost` becomes their number.
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

    mutable std::mutex _mutex;  // nothing is waited for under it
    std::array<Entry, FLAGS> _entries;
    std::array<Transition, CAPACITY> _latest;
    std::uint64_t _count = 0;
    std::array<Reader*, MOST_READERS> _readers = {};
    Clock::duration _staleAfter;
};

}  // namespace ternhad
