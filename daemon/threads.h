#pragma once

#include <functional>
#include <future>
#include <thread>
#include <vector>

#include "event.h"

namespace ternhad {

// The daemon's threads. They end when Shutdown is requested; what one is stuck in cannot keep the others.
class Threads {
 public:
    // Sets up SIGUSR1, which interrupts the calls that a thread waits in.
    Threads();

    // `name`: at most 15 characters, for ps and top.
    void start(const char* name, std::function<void()> body);

    // Interrupts all threads, ends the programs that they wait for, and joins them. False when some have not
    // ended by `deadline`: the process can only exit then.
    bool join(Clock::time_point deadline);

 private:
    struct Worker {
        std::thread thread;
        std::future<void> end;
    };
    std::vector<Worker> _workers;
};

// Gives the calling thread a descriptor table of its own. What is open stays open in it under the same
// number; what is opened from now on is this thread's alone. A thread that hangs in the kernel keeps a killed
// process's table, and so its sockets and locks: not those of a table that no hanging thread uses. False
// where this is not permitted.
bool isolateDescriptors() noexcept;

// Puts the calling thread before all that are not real-time threads, as far as this is permitted. Probes come
// before replies, of which anybody on the link may request any number.
enum class Priority { probes, replies };
void raisePriority(Priority priority) noexcept;

}  // namespace ternhad
