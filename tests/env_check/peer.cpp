#include "env_check/peer.h"

#include <arpa/inet.h>

#include <array>
#include <chrono>
#include <cstdio>
#include <optional>

#include "support/files.h"

using namespace std::chrono_literals;

namespace test {

FakePeer::FakePeer(const std::string& reply)
    : _reply(reply), _socket(PEER_ADDRESS, PEER_PORT), _thread(&FakePeer::serve, this) {}

FakePeer::~FakePeer() {
    _stopped = true;
    _thread.join();
}

std::vector<std::string> FakePeer::requests() {
    const std::lock_guard lock(_mutex);
    return _requests;
}

void FakePeer::serve() {
    while (!_stopped) {
        if (const std::optional<Datagram> request = _socket.receive(10ms)) {
            {
                const std::lock_guard lock(_mutex);
                _requests.push_back(request->bytes);
            }
            _socket.send(_reply, request->address, request->port);
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
