#include "support/udp.h"

#include <arpa/inet.h>
#include <poll.h>
#include <sys/socket.h>

namespace test {
namespace {

// An IPv4 address as the system calls take it.
struct Address {
    explicit Address(const std::string& address = "0.0.0.0", uint16_t port = 0) {
        in.sin_family = AF_INET;
        in.sin_port = htons(port);
        check(inet_pton(AF_INET, address.c_str(), &in.sin_addr) == 1, "not an IPv4 address: " + address);
    }
    sockaddr* get() { return reinterpret_cast<sockaddr*>(&in); }

    sockaddr_in in{};
    socklen_t size = sizeof in;
};

}  // namespace

UdpSocket::UdpSocket(const std::string& address, uint16_t port)
    : _socket(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0), "cannot make a socket") {
    Address own(address, port);
    check(bind(_socket.get(), own.get(), own.size) == 0,
          "cannot bind " + address + ":" + std::to_string(port));
}

uint16_t UdpSocket::port() const {
    Address own;
    check(getsockname(_socket.get(), own.get(), &own.size) == 0, "no socket name");
    return ntohs(own.in.sin_port);
}

void UdpSocket::send(const std::string& bytes, const std::string& address, uint16_t port) {
    Address peer(address, port);
    const ssize_t sent = sendto(_socket.get(), bytes.data(), bytes.size(), 0, peer.get(), peer.size);
    check(sent == static_cast<ssize_t>(bytes.size()), "cannot send to " + address);
}

std::optional<Datagram> UdpSocket::receive(std::chrono::milliseconds deadline) {
    pollfd waited{_socket.get(), POLLIN, 0};
    if (poll(&waited, 1, static_cast<int>(deadline.count())) <= 0) {
        return std::nullopt;
    }
    char bytes[65536];
    Address peer;
    const ssize_t received = recvfrom(_socket.get(), bytes, sizeof bytes, 0, peer.get(), &peer.size);
    check(received >= 0, "cannot receive");
    return Datagram{
        {bytes, static_cast<std::size_t>(received)}, inet_ntoa(peer.in.sin_addr), ntohs(peer.in.sin_port)};
}

}  // namespace test
