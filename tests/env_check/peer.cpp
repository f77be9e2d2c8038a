#include "env_check/peer.h"

#include <arpa/inet.h>

#include <array>
#include <chrono>
#include <cstdio>
#include <optional>

#include "support/files.h"

using namespace std::chrono_literals;

namespace test {

FakePeer::FakePeer(const std::string& answer)
    : answer_(answer), socket_(kPeerAddress, kPeerPort), thread_(&FakePeer::serve, this) {}

FakePeer::~FakePeer() {
    stopped_ = true;
    thread_.join();
}

std::vector<std::string> FakePeer::questions() {
    const std::lock_guard lock(mutex_);
    return questions_;
}

void FakePeer::serve() {
    while (!stopped_) {
        if (const std::optional<Datagram> question = socket_.receive(10ms)) {
            {
                const std::lock_guard lock(mutex_);
                questions_.push_back(question->bytes);
            }
            socket_.send(answer_, question->address, question->port);
        }
    }
}

std::vector<std::string> arrived(UdpSocket& socket) {
    std::vector<std::string> all;
    while (const std::optional<Datagram> datagram = socket.receive(0ms)) {
        all.push_back(datagram->bytes);
    }
    return all;
}

bool isBound(const std::string& address, std::uint16_t port, const std::string& table) {
    in_addr parsed = {};
    inet_pton(AF_INET, address.c_str(), &parsed);
    std::array<char, 32> entry = {};
    std::snprintf(entry.data(), entry.size(), ": %08X:%04X ", parsed.s_addr, static_cast<unsigned int>(port));
    return readFile(table).find(entry.data()) != std::string::npos;
}

}  // namespace test
