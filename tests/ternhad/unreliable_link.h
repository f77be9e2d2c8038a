#pragma once

#include <netinet/in.h>

#include <atomic>
#include <chrono>
#include <map>
#include <memory>
#include <queue>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "support/descriptor.h"
#include "support/node.h"

namespace test {

// What an unreliable link does to the datagrams, in percent of them.
struct Faults {
    unsigned int lost = 0;
    unsigned int doubled = 0;
    unsigned int late = 0;                 // by 3 to 6 seconds; all others by up to `delay`
    std::chrono::milliseconds delay{200};  // at random, so that they overtake each other
};

// Carries the peer protocol between two nodes that have no other link: each finds the other's address on its
// own loopback interface, with this relay behind it.
class UnreliableLink {
 public:
    UnreliableLink(Node& a, const std::string& addressA, Node& b, const std::string& addressB, Faults faults,
                   unsigned int seed);
    ~UnreliableLink();

    UnreliableLink(const UnreliableLink&) = delete;
    UnreliableLink& operator=(const UnreliableLink&) = delete;

 private:
    using Clock = std::chrono::steady_clock;

    // A node's end: where its questions come in, and how to reach its server.
    struct End {
        Descriptor questions;
        sockaddr_in server;
        int network;  // the node's, by an open file
    };

    // A question on its way: the socket at which the answer comes in, and who asked.
    struct Question {
        std::unique_ptr<Descriptor> socket;
        const End* asker;
        sockaddr_in port;
        Clock::time_point end;
    };

    struct Delivery {
        Clock::time_point time;
        std::string bytes;
        // Either an answer to the asker or a question to the other node's server.
        const End* from;
        const End* to;
        sockaddr_in asker;
        bool isAnswer;

        bool operator>(const Delivery& other) const { return time > other.time; }
    };

    void run();
    void plan(Delivery delivery);
    void deliver(const Delivery& delivery);
    void receiveQuestion(const End& asker, const End& other);

    Faults _faults;
    std::mt19937 _random;
    std::unique_ptr<End> _a;
    std::unique_ptr<End> _b;
    std::vector<Question> _questions;
    std::priority_queue<Delivery, std::vector<Delivery>, std::greater<>> _deliveries;
    std::atomic<bool> _isOver{false};
    std::thread _thread;
};

}  // namespace test
