#include "transitions.h"

#include <algorithm>
#include <stdexcept>

#include "wall_clock.h"

namespace ternhad {

// peerAlive is never stale: the failure detector always knows.
bool Transitions::isStale(Flag flag, const Entry& entry, Clock::time_point now) const noexcept {
    return entry.state.value && flag != Flag::peerAlive &&
           (!entry.isConfirmed || now - entry.lastCheck > _staleAfter);
}

void Transitions::found(Flag flag, bool value) noexcept {
    const std::lock_guard<std::mutex> lock(_mutex);
    Entry& entry = entryOf(flag);
    State& state = entry.state;
    const auto now = Clock::now();
    if (isReportedByPeer(flag) && entryOf(Flag::peerAlive).state.value != true) {
        return;  // late reply of a peer that is dead by now
    }
    const bool wasStale = isStale(flag, entry, now);
    state.checked = wallClock();
    entry.lastCheck = now;
    entry.isConfirmed = true;
    if (state.value == value && !wasStale) {
        return;
    }
    if (flag == Flag::peerAlive && !value) {
        entryOf(Flag::peerResync).isConfirmed = false;
        entryOf(Flag::peerDiskErrors).isConfirmed = false;
    }
    Transition& transition = _latest.at(_count++ % CAPACITY);
    transition = {flag, state.value, value, state.checked};
    if (wasStale) {
        transition.old.reset();
    }
    state.changes += state.value == !value ? 1U : 0U;
    state.value = value;
    state.since = state.checked;
    for (Reader* reader : _readers) {
        if (reader != nullptr) {
            reader->_event.set();
        }
    }
}

Transitions::State Transitions::state(Flag flag) const noexcept {
    const std::lock_guard<std::mutex> lock(_mutex);
    const Entry& entry = _entries.at(static_cast<std::size_t>(flag));
    State state = entry.state;
    state.isStale = isStale(flag, entry, Clock::now());
    return state;
}

Transitions::Reader::Reader(Transitions& transitions) : _transitions(transitions), _position(0) {
    const std::lock_guard<std::mutex> lock(transitions._mutex);
    _position = transitions._count;
    auto* const place = std::find(transitions._readers.begin(), transitions._readers.end(), nullptr);
    if (place == transitions._readers.end()) {
        throw std::logic_error("too many readers of transitions");
    }
    *place = this;
}

Transitions::Reader::~Reader() {
    const std::lock_guard<std::mutex> lock(_transitions._mutex);
    *std::find(_transitions._readers.begin(), _transitions._readers.end(), this) = nullptr;
}

std::optional<Transition> Transitions::Reader::next(std::uint64_t& lost) noexcept {
    const std::lock_guard<std::mutex> lock(_transitions._mutex);
    const std::uint64_t oldest = _transitions._count - std::min<std::uint64_t>(_transitions._count, CAPACITY);
    lost = oldest - std::min(oldest, _position);
    _position += lost;
    if (_position == _transitions._count) {
        return std::nullopt;
    }
    return _transitions._latest.at(_position++ % CAPACITY);
}

}  // namespace ternhad
