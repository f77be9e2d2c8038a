#pragma once

#include <mutex>
#include <string>
#include <vector>

#include "event.h"
#include "report.h"
#include "transitions.h"

namespace ternhad {

// Sends each state transition to the clients that requested events, up to 16. For one thread, which
// never blocks on a client: a client that does not read is disconnected.
class EventStreams {
 public:
    EventStreams(Transitions& transitions, const Reporter& reporter, const Shutdown& shutdown)
        : _reader(transitions), _reporter(reporter), _shutdown(shutdown) {}
    ~EventStreams();

    EventStreams(const EventStreams&) = delete;
    EventStreams& operator=(const EventStreams&) = delete;

    // Take ownership of a connection. Returns false if there are too many. Callable from any
    // thread.
    bool add(int fd);

    // Thread body.
    void run();

 private:
    void sendChanges();
    void greetNewClients();
    void dropClosedClients();
    void wait();
    void sendTo(int& fd, const std::string& line);

    Transitions::Reader _reader;
    const Reporter& _reporter;
    const Shutdown& _shutdown;
    Event _added;
    std::mutex _mutex;       // guards the next two
    std::vector<int> _new;   // connections that have not received the report yet
    std::size_t _count = 0;  // of all connections
    std::vector<int> _clients;
};

}  // namespace ternhad
