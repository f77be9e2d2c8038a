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

// A change of a flag; the result of its first check changes it from unknown.
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
        std::uint64_t changes = 0;  // after the first check
    };

    Transitions() = default;
    Transitions(const Transitions&) = delete;
    Transitions& operator=(const Transitions&) = delete;

    // Records what a check of `flag` found. Neither blocks nor allocates.
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

    mutable std::mutex _mutex;  // nothing is waited for under it
    std::array<State, FLAGS> _states;
    std::array<Transition, CAPACITY> _latest;
    std::uint64_t _count = 0;
    std::array<Reader*, MOST_READERS> _readers = {};
};

}  // namespace ternhad
