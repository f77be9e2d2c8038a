#pragma once

#include <sys/types.h>

namespace ternhad {

// The lock that one daemon of this machine holds, in /run/ternha/ternhad.lock.
class InstanceLock {
 public:
    InstanceLock() = default;
    ~InstanceLock();

    InstanceLock(const InstanceLock&) = delete;
    InstanceLock& operator=(const InstanceLock&) = delete;

    enum class Result { taken, isRunning, failed };

    // Takes the lock; does not wait. `isRunning`: owner() has it. `failed`: errno tells why.
    Result take();

    pid_t owner() const { return _owner; }

    // Leaves the lock to a thread whose descriptor table is its own.
    void handOver();

 private:
    int _fd = -1;
    pid_t _owner = 0;
};

}  // namespace ternhad
