#pragma once

#include <string>

#include "event.h"
#include "transitions.h"

namespace ternhad {

// Tells the journal of each change, by a line on standard error with a level, and the service manager what
// state the node is in. For one thread, which may be stuck for as long as the manager is.
class Announcer {
 public:
    Announcer(Transitions& transitions, const Shutdown& shutdown)
        : _transitions(transitions), _reader(transitions), _shutdown(shutdown) {}

    // Body of the thread.
    void run();

 private:
    void announce(const Transition& transition);
    std::string summary() const;

    Transitions& _transitions;
    Transitions::Reader _reader;
    const Shutdown& _shutdown;
    std::string _status;  // as the manager knows it
};

}  // namespace ternhad
