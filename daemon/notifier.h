#pragma once

#include <sys/types.h>

#include <string>

#include "event.h"
#include "events.h"
#include "health.h"
#include "options.h"
#include "transitions.h"

namespace ternhad {

// Runs the `notify` program at each state transition, one at a time, for up to 30 seconds each. For
// one thread; nothing waits for it.
class Notifier {
 public:
    Notifier(const Options& options, Health& health, Events& events, const Shutdown& shutdown)
        : _options(options),
          _reader(health.transitions()),
          _findings(health.findings()),
          _events(events),
          _shutdown(shutdown) {}

    // Thread body.
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
