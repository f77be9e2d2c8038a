#include "event.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <limits>
#include <stdexcept>
#include <system_error>

namespace ternhad {

namespace {

std::atomic<bool> isSealed{false};

int newEvent() {
    if (isSealed) {
        throw std::logic_error("an event that some threads do not have");
    }
    const int fd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (fd < 0) {
        throw std::system_error(errno, std::generic_category(), "eventfd");
    }
    return fd;
}

}  // namespace

Event::Event() : _fd(newEvent()) {}

Event::~Event() {
    close(_fd);
}

void Event::seal() noexcept {
    isSealed = true;
}

void Event::set() noexcept {
    const std::uint64_t one = 1;
    // Fails only at a count of 2^64 - 2.
    [[maybe_unused]] const ssize_t written = write(_fd, &one, sizeof one);
}

bool Event::take() noexcept {
    std::uint64_t count = 0;
    return read(_fd, &count, sizeof count) == sizeof count;
}

void Shutdown::request(int exitCode) noexcept {
    _exitCode = exitCode;
    _isRequested = true;
    _event.set();
}

bool Shutdown::sleepUntil(Clock::time_point time, std::initializer_list<const Event*> others) const noexcept {
    std::array<pollfd, 4> waits = {};
    std::size_t count = 0;
    waits.at(count++) = {_event.fd(), POLLIN, 0};
    for (const Event* other : others) {
        waits.at(count++) = {other->fd(), POLLIN, 0};
    }
    while (!isRequested()) {
        if (pollUntil(time, waits.data(), count) >= 0) {
            break;
        }
    }
    return !isRequested();
}

bool Shutdown::waitFor(const Event& event) const noexcept {
    return sleepUntil(Clock::now() + std::chrono::hours(24), {&event});
}

Clock::time_point nextRound(Clock::time_point round, std::chrono::duration<double> interval) noexcept {
    return std::max(round + std::chrono::duration_cast<Clock::duration>(interval), Clock::now());
}

// Not ppoll(): on 32-bit machines with 64-bit times and _FORTIFY_SOURCE, that of glibc before 2.37
// drops the fraction of a second of its timeout, and the caller spins.
int pollUntil(Clock::time_point time, pollfd* waits, std::size_t count) noexcept {
    using std::chrono::milliseconds;
    const auto rest = std::chrono::ceil<milliseconds>(time - Clock::now());
    const auto timeout = std::clamp(rest, milliseconds(0), milliseconds(std::numeric_limits<int>::max()));
    return poll(waits, count, static_cast<int>(timeout.count()));
}

}  // namespace ternhad
