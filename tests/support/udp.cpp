#include "support/udp.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>

#include <cerrno>
#include <stdexcept>

namespace test {
namespace {

void check(bool done, const std::string& what) {
    if (!done) {
        throw std::system_error(errno, std::generic_category(), what);
    }
}

sockaddr_in socketAddress(const std::string& address, uint16_t port) {
    sockaddr_in result{};
    result.sin_family = AF_INET;
    result.sin_port = htons(port);
    if (inet_pton(AF_INET, address.c_str(), &result.sin_addr) != 1) {
        throw std::invalid_argument("not an IPv4 address: " + address);
    }
    return result;
}

}  // namespace

UdpSocket::UdpSocket(const std::string& address, uint16_t port) {
    _socket = Descriptor(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0), "cannot make a socket");
    const sockaddr_in own = socketAddress(address, port);
    check(bind(_socket.get(), reinterpret_cast<const sockaddr*>(&own), sizeof own) == 0,
          "cannot bind " + address + ":" + std::to_string(port));
}

uint16_t UdpSocket::port() const {
    sockaddr_in own{};
    socklen_t length = sizeof own;
    check(getsockname(_socket.get(), reinterpret_cast<sockaddr*>(&own), &length) == 0, "no socket name");
    return ntohs(own.sin_port);
}

void UdpSocket::send(const std::string& bytes, const std::string& address, uint16_t port) {
    const sockaddr_in peer = socketAddress(address, port);
    const ssize_t sent = sendto(_socket.get(), bytes.data(), bytes.size(), 0,
                                reinterpret_cast<const sockaddr*>(&peer), sizeof peer);
    check(sent == static_cast<ssize_t>(bytes.size()), "cannot send to " + address);
}

std::optional<Datagram> UdpSocket::receive(std::chrono::milliseconds deadline) {
    pollfd waited{_socket.get(), POLLIN, 0};
    if (poll(&waited, 1, static_cast<int>(deadline.count())) <= 0) {
        return std::nullopt;
    }
    char bytes[65536];
    sockaddr_in peer{};
    socklen_t length = sizeof peer;
    const ssize_t received =
        recvfrom(_socket.get(), bytes, sizeof bytes, 0, reinterpret_cast<sockaddr*>(&peer), &length);
    check(received >= 0, "cannot receive");
    char address[INET_ADDRSTRLEN];
    inet_ntop(AF_INET, &peer.sin_addr, address, sizeof address);
    return Datagram{{bytes, static_cast<size_t>(received)}, address, ntohs(peer.sin_port)};
}

}  // namespace test
