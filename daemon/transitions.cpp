#include "transitions.h"

#include <algorithm>
#include <stdexcept>

#include "wall_clock.h"

namespace ternhad {

void Transitions::found(Flag flag, bool value) noexcept {
    const std::lock_guard<std::mutex> lock(_mutex);
    State& state = _states.at(static_cast<std::size_t>(flag));
    const bool isFirst = !state.value;
    if (state.value == value) {
        return;
    }
    const Time now = wallClock();
    _latest.at(_count++ % CAPACITY) = {flag, state.value, value, now};
    state.value = value;
    state.since = now;
    state.changes += isFirst ? 0 : 1;
    for (Reader* reader : _readers) {
        if (reader != nullptr) {
            reader->_event.set();
        }
    }
}

Transitions::State Transitions::state(Flag flag) const noexcept {
    const std::lock_guard<std::mutex> lock(_mutex);
    return _states.at(static_cast<std::size_t>(flag));
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
