#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "support/udp.h"

/// Both ends of the peer protocol for tests, on loopback addresses.
namespace test {

constexpr std::uint16_t PEER_PORT = 7499;
constexpr const char* PEER_ADDRESS = "127.0.0.2";
constexpr const char* SERVER = "127.0.0.2";  ///< address of a server under test

/// A stub peer that sends the same reply to every request at PEER_ADDRESS.
class FakePeer {
 public:
    explicit FakePeer(const std::string& reply);
    ~FakePeer();

    FakePeer(const FakePeer&) = delete;
    FakePeer& operator=(const FakePeer&) = delete;

    /// Return the requests received so far.
    std::vector<std::string> requests();

 private:
    void serve();

    const std::string _reply;
    UdpSocket _socket;
    std::atomic<bool> _stopped{false};
    std::mutex _mutex;
    std::vector<std::string> _requests;
    std::thread _thread;
};

/// Return the datagrams queued at `socket`.
std::vector<std::string> arrived(UdpSocket& socket);

/// Return whether the kernel's table lists a UDP socket bound to the address and port.
bool isBound(const std::string& address, std::uint16_t port, const std::string& table = "/proc/net/udp");

}  // namespace test
