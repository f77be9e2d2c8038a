#include "events.h"

#include <cstring>
#include <exception>
#include <utility>

#include "ha_log.h"
#include "passes.h"
#include "wall_clock.h"

namespace ternhad {

void Events::changed(Flag flag, bool value) noexcept {
    Happening happening;
    happening.kind = Happening::Kind::change;
    happening.flag = flag;
    happening.value = value;
    push(std::move(happening));
}

void Events::troubleBegan(const char* what, int error) noexcept {
    Happening happening;
    happening.kind = Happening::Kind::trouble;
    happening.what = what;
    happening.error = error;
    push(std::move(happening));
}

void Events::troubleEnded(const char* what) noexcept {
    Happening happening;
    happening.kind = Happening::Kind::recovery;
    happening.what = what;
    push(std::move(happening));
}

void Events::log(const char* file, int line, std::string text) noexcept {
    Happening happening;
    happening.file = file;
    happening.line = line;
    happening.text = std::move(text);
    push(std::move(happening));
}

void Events::push(Happening&& happening) noexcept {
    happening.time = wallClock();
    const std::lock_guard<std::mutex> lock(_mutex);
    if (_count == CAPACITY) {
        ++_lost;
        return;
    }
    _queue[(_first + _count) % CAPACITY] = std::move(happening);
    ++_count;
    _wakeUp.notify_one();
}

bool Events::pop(Happening& happening, std::size_t& lost) {
    std::unique_lock<std::mutex> lock(_mutex);
    _isWriting = false;
    _written.notify_all();
    _wakeUp.wait(lock, [this] { return _count > 0 || _isEnding; });
    if (_count == 0) {
        return false;
    }
    happening = std::move(_queue[_first]);
    _first = (_first + 1) % CAPACITY;
    --_count;
    lost = std::exchange(_lost, 0);
    _isWriting = true;
    return true;
}

void Events::run() {
    Happening happening;
    std::size_t lost = 0;
    while (pop(happening, lost)) {
        attempt([&] {
            if (lost > 0) {
                HA_LOG("Events lost: " + std::to_string(lost));
            }
            write(happening);
        });
    }
}

void Events::end() noexcept {
    const std::lock_guard<std::mutex> lock(_mutex);
    _isEnding = true;
    _wakeUp.notify_one();
}

void Events::waitUntilWritten(std::chrono::milliseconds limit) {
    std::unique_lock<std::mutex> lock(_mutex);
    _written.wait_for(lock, limit, [this] { return _count == 0 && !_isWriting; });
}

void Events::write(const Happening& happening) {
    switch (happening.kind) {
        case Happening::Kind::change:
            if (happening.flag == Flag::peerAlive) {
                _logged.setRemoteAlive(happening.value);
            }
            break;
        case Happening::Kind::trouble:
            HA_LOG(std::string("Cannot ") + happening.what + ": " + std::strerror(happening.error));
            break;
        case Happening::Kind::recovery:
            HA_LOG(std::string("Can ") + happening.what + " again");
            break;
        case Happening::Kind::message:
            TERN::HA::Daemon::logAt(happening.file, happening.line, happening.text);
            break;
    }
}

}  // namespace ternhad
