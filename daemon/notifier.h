#pragma once

#include <sys/types.h>

#include <string>

#include "event.h"
#include "events.h"
#include "health.h"
#include "options.h"
#include "transitions.h"

namespace ternhad {

// Runs the program of the option `notify` at each change, one at a time and each for up to 30 seconds. For
// one thread; nothing else waits for it.
class Notifier {
 public:
    Notifier(const Options& options, Health& health, Events& events, const Shutdown& shutdown)
        : _options(options),
          _reader(health.transitions()),
          _findings(health.findings()),
          _events(events),
          _shutdown(shutdown) {}

    // Body of the thread.
    void run();

 private:
    void notify(const Transition& transition);
    pid_t start(const Transition& transition);
    bool waitFor(pid_t process, int& status) const;

    const Options& _options;
    Transitions::Reader _reader;
    const Findings& _findings;
    Events& _events;
    const Shutdown& _shutdown;
};

}  // namespace ternhad
