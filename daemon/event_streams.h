#pragma once

#include <mutex>
#include <string>
#include <vector>

#include "event.h"
#include "report.h"
#include "transitions.h"

namespace ternhad {

// Sends each change to the clients that asked for the events, up to 16. For one thread, which waits for none
// of them: a client that does not read loses its connection.
class EventStreams {
 public:
    EventStreams(Transitions& transitions, const Reporter& reporter, const Shutdown& shutdown)
        : _reader(transitions), _reporter(reporter), _shutdown(shutdown) {}
    ~EventStreams();

    EventStreams(const EventStreams&) = delete;
    EventStreams& operator=(const EventStreams&) = delete;

    // Takes over a connection. False when there are too many. Any thread.
    bool add(int fd);

    // Body of the thread.
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
    std::vector<int> _new;   // connections that were not greeted yet
    std::size_t _count = 0;  // of all connections
    std::vector<int> _clients;
};

}  // namespace ternhad
