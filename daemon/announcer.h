#pragma once

#include <string>

#include "event.h"
#include "health.h"

namespace ternhad {

// Logs each state transition to the journal, as a line with a priority on standard error, and
// updates the service manager's status line. For one thread, which may block for as long as the
// journal or the manager does.
class Announcer {
 public:
    Announcer(Health& health, const Shutdown& shutdown)
        : _findings(health.findings()),
          _transitions(health.transitions()),
          _reader(_transitions),
          _shutdown(shutdown) {}

    // Thread body.
    void run();

 private:
    void announce(const Transition& transition);
    void announceDrbd();
    std::string summary() const;

    const Findings& _findings;
    Transitions& _transitions;
    Transitions::Reader _reader;
    const Shutdown& _shutdown;
    std::string _status;  // last status line sent to the manager
    std::string _unsupportedDrbd;
};

}  // namespace ternhad
