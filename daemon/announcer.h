#pragma once

#include <string>

#include "event.h"
#include "health.h"

namespace ternhad {

// Tells the journal of each change, by a line on standard error with a level, and the service manager what
// state the node is in. For one thread, which may be stuck for as long as the manager is.
class Announcer {
 public:
    Announcer(Health& health, const Shutdown& shutdown)
        : _findings(health.findings()),
          _transitions(health.transitions()),
          _reader(_transitions),
          _shutdown(shutdown) {}

    // Body of the thread.
    void run();

 private:
    void announce(const Transition& transition);
    void announceDrbd();
    std::string summary() const;

    const Findings& _findings;
    Transitions& _transitions;
    Transitions::Reader _reader;
    const Shutdown& _shutdown;
    std::string _status;  // as the manager knows it
    std::string _unsupportedDrbd;
};

}  // namespace ternhad
