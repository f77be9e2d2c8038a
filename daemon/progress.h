#pragma once

#include <array>
#include <atomic>
#include <cstddef>

namespace ternhad {

// Progress of the threads that the watchdog covers.
class Progress {
 public:
    enum Thread { prober, peerServer, controlServer, nodeWatcher, COUNT };

    void made(Thread thread) noexcept { _isMade.at(thread) = true; }

    // Return true if each thread has made progress since this last returned true.
    bool isComplete() noexcept {
        for (const auto& isMade : _isMade) {
            if (!isMade) {
                return false;
            }
        }
        for (auto& isMade : _isMade) {
            isMade = false;
        }
        return true;
    }

 private:
    std::array<std::atomic<bool>, COUNT> _isMade = {};
};

}  // namespace ternhad
