#include "ternhad/unreliable_link.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <functional>
#include <stdexcept>

#include "support/programs.h"

namespace test {

namespace {

using namespace std::chrono_literals;

constexpr std::uint16_t PEER_PORT = 7499;
constexpr auto QUESTION_LIFE = 10s;
constexpr int STEP = 5;  // milliseconds between two looks at what is due

sockaddr_in addressOf(const std::string& address, std::uint16_t port) {
    sockaddr_in result = {};
    result.sin_family = AF_INET;
    result.sin_port = htons(port);
    inet_pton(AF_INET, address.c_str(), &result.sin_addr);
    return result;
}

// A socket of the node's network. Only a thread of its own can go there for a moment.
int socketIn(int network, const sockaddr_in& address) {
    int fd = -1;
    std::thread([&] {
        if (setns(network, CLONE_NEWNET) == 0) {
            fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
            if (fd >= 0 && bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
                close(fd);
                fd = -1;
            }
        }
    }).join();
    return fd;
}

void addToLoopback(Node& node, const std::string& address) {
    if (node.run({"ip", "address", "add", address + "/32", "dev", "lo"}).exitCode != 0) {
        throw std::runtime_error("cannot add an address");
    }
}

}  // namespace

UnreliableLink::UnreliableLink(Node& a, const std::string& addressA, Node& b, const std::string& addressB,
                               Faults faults, unsigned int seed)
    : _faults(faults), _random(seed) {
    const auto makeEnd = [](Node& node, const std::string& own, const std::string& other) {
        addToLoopback(node, own);
        addToLoopback(node, other);
        const std::string path = "/.kernel/proc/" + std::to_string(node.pid()) + "/ns/net";
        const int network = open(path.c_str(), O_RDONLY | O_CLOEXEC);
        return std::unique_ptr<End>(new End{{socketIn(network, addressOf(other, PEER_PORT)), "relay socket"},
                                            addressOf(own, PEER_PORT),
                                            network});
    };
    _a = makeEnd(a, addressA, addressB);
    _b = makeEnd(b, addressB, addressA);
    _thread = std::thread([this] { run(); });
}

UnreliableLink::~UnreliableLink() {
    _isOver = true;
    _thread.join();
    close(_a->network);
    close(_b->network);
}

void UnreliableLink::run() {
    while (!_isOver) {
        std::vector<pollfd> waits = {{_a->questions.get(), POLLIN, 0}, {_b->questions.get(), POLLIN, 0}};
        for (const Question& question : _questions) {
            waits.push_back({question.socket->get(), POLLIN, 0});
        }
        poll(waits.data(), waits.size(), STEP);

        // Answers first: a new question changes the list.
        for (std::size_t i = 0; i < _questions.size(); ++i) {
            std::array<char, 2048> buffer;
            const ssize_t size = recv(_questions[i].socket->get(), buffer.data(), buffer.size(), 0);
            if (size >= 0) {
                plan({{},
                      {buffer.data(), static_cast<std::size_t>(size)},
                      nullptr,
                      _questions[i].asker,
                      _questions[i].port,
                      true});
            }
        }
        receiveQuestion(*_a, *_b);
        receiveQuestion(*_b, *_a);
        while (!_deliveries.empty() && _deliveries.top().time <= Clock::now()) {
            deliver(_deliveries.top());
            _deliveries.pop();
        }
        const auto isForgotten = [](const Question& question) { return question.end < Clock::now(); };
        _questions.erase(std::remove_if(_questions.begin(), _questions.end(), isForgotten), _questions.end());
    }
}

void UnreliableLink::receiveQuestion(const End& asker, const End& other) {
    std::array<char, 2048> buffer;
    sockaddr_in from = {};
    socklen_t length = sizeof from;
    ssize_t size = 0;
    while ((size = recvfrom(asker.questions.get(), buffer.data(), buffer.size(), 0,
                            reinterpret_cast<sockaddr*>(&from), &length)) >= 0) {
        plan({{}, {buffer.data(), static_cast<std::size_t>(size)}, &asker, &other, from, false});
    }
}

void UnreliableLink::plan(Delivery delivery) {
    const auto happens = [this](unsigned int percent) {
        return std::uniform_int_distribution<unsigned int>(1, 100)(_random) <= percent;
    };
    const auto between = [this](std::chrono::milliseconds from, std::chrono::milliseconds to) {
        return std::chrono::milliseconds(
            std::uniform_int_distribution<std::int64_t>(from.count(), to.count())(_random));
    };
    if (happens(_faults.lost)) {
        return;
    }
    const int copies = happens(_faults.doubled) ? 2 : 1;
    for (int i = 0; i < copies; ++i) {
        delivery.time =
            Clock::now() + (happens(_faults.late) ? between(3s, 6s) : between(0ms, _faults.delay));
        _deliveries.push(delivery);
    }
}

void UnreliableLink::deliver(const Delivery& delivery) {
    const auto send = [&delivery](int fd, const sockaddr_in& to) {
        sendto(fd, delivery.bytes.data(), delivery.bytes.size(), 0, reinterpret_cast<const sockaddr*>(&to),
               sizeof to);
    };
    if (delivery.isAnswer) {
        send(delivery.to->questions.get(), delivery.asker);
        return;
    }
    // Towards the server as from the asker's address, from a port of its own.
    sockaddr_in source = delivery.from->server;
    source.sin_port = 0;
    auto socket = std::make_unique<Descriptor>(socketIn(delivery.to->network, source), "relay socket");
    send(socket->get(), delivery.to->server);
    _questions.push_back({std::move(socket), delivery.from, delivery.asker, Clock::now() + QUESTION_LIFE});
}

}  // namespace test
