#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "support/udp.h"

/// The two ends of the peer protocol as tests see them, on addresses of the loopback network.
namespace test {

constexpr std::uint16_t kPeerPort = 7499;
constexpr const char* kPeerAddress = "127.0.0.2";
constexpr const char* kServer = "127.0.0.2";  ///< where a server under test serves

/// Stands in for the other node: gives the same answer to everyone who asks kPeerAddress.
class FakePeer {
 public:
    explicit FakePeer(const std::string& answer);
    ~FakePeer();

    FakePeer(const FakePeer&) = delete;
    FakePeer& operator=(const FakePeer&) = delete;

    /// The questions up to now.
    std::vector<std::string> questions();

 private:
    void serve();

    const std::string answer_;
    UdpSocket socket_;
    std::atomic<bool> stopped_{false};
    std::mutex mutex_;
    std::vector<std::string> questions_;
    std::thread thread_;
};

/// The datagrams that have arrived at `socket` and were not received yet.
std::vector<std::string> arrived(UdpSocket& socket);

/// Whether a UDP socket is bound to the address and port, as the kernel's list `table` has it.
bool isBound(const std::string& address, std::uint16_t port, const std::string& table = "/proc/net/udp");

}  // namespace test
