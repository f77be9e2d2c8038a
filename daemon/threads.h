#pragma once

#include <functional>
#include <future>
#include <thread>
#include <vector>

#include "event.h"

namespace ternhad {

// The daemon's threads. They end when Shutdown is requested; one that hangs does not keep the
// others.
class Threads {
 public:
    // Set up SIGUSR1, which interrupts blocking system calls.
    Threads();

    // name: for ps and top; at most 15 characters, which stay valid.
    void start(const char* name, std::function<void()> body);

    // Interrupt all threads, terminate the programs that they wait for, and join them. Returns
    // false if some have not ended by `deadline`: the process can only exit then.
    bool join(Clock::time_point deadline);

 private:
    struct Worker {
        std::thread thread;
        std::future<void> end;
    };
    std::vector<Worker> _workers;
};

// Give the calling thread its own descriptor table. Open descriptors keep their numbers; new ones
// belong to this thread alone. A thread that hangs in the kernel keeps the descriptor table of a
// killed process alive, and with it sockets and locks; tables of other threads are released.
// Returns false if this is not permitted.
bool isolateDescriptors() noexcept;

// Give the calling thread real-time priority, if permitted. Probes precede replies, of which anyone
// on the link can request any number. The journal comes third, so that busy programs do not delay it.
enum class Priority { probes, replies, journal };
void raisePriority(Priority priority) noexcept;

}  // namespace ternhad
