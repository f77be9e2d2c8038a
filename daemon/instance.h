#pragma once

#include <sys/types.h>

namespace ternhad {

// Lock of the running daemon, /run/ternha/ternhad.lock: one per machine.
class InstanceLock {
 public:
    InstanceLock() = default;
    ~InstanceLock();

    InstanceLock(const InstanceLock&) = delete;
    InstanceLock& operator=(const InstanceLock&) = delete;

    enum class Result { taken, isRunning, failed };

    // Take the lock without blocking. `isRunning`: owner() holds it. `failed`: errno has the
    // reason.
    Result take();

    pid_t owner() const { return _owner; }

    // Leave the lock to a thread that has its own descriptor table.
    void handOver();

 private:
    int _fd = -1;
    pid_t _owner = 0;
};

}  // namespace ternhad
