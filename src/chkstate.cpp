#include "chkstate.h"

#include <arpa/inet.h>
#include <sys/time.h>
#include <syslog.h>
#include <unistd.h>

#include <array>
#include <cerrno>

#include "ha_log.h"

namespace {

// At most 63 bytes of a datagram are read; the last byte ends the text.
using Message = std::array<char, 64>;

sockaddr* asSockaddr(sockaddr_in& address) {
    return reinterpret_cast<sockaddr*>(&address);
}

bool setRecvTimeout(int fd, std::uint32_t seconds) {
    timeval timeout = {};
    timeout.tv_sec = seconds;
    return setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout) == 0;
}

int takeMessage(ssize_t received, Message& message, std::string& out) {
    if (received == -1) {
        return -1;
    }
    message.at(static_cast<std::size_t>(received)) = '\0';
    out = message.data();
    return static_cast<int>(received);
}

}  // namespace

HASocketComm::HASocketComm(const std::string& ip)
    : sockFd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)), peerAddr(), recvTimeout(), hasError(sockFd < 0) {
    peerAddr.sin_family = AF_INET;
    peerAddr.sin_port = htons(HA_PEER_PORT);
    // Frozen: docs/compatibility.md#unparsable-address
    inet_pton(AF_INET, ip.c_str(), &peerAddr.sin_addr);
    if (hasError) {
        const int error = errno;
        syslog(LOG_ERR, "%s:%d Failed to set socket", __FILE_NAME__, __LINE__);
        errno = error;
    }
}

HASocketComm::~HASocketComm() {
    if (sockFd >= 0) {
        close(sockFd);
    }
}

// Not const: the qualifier would be part of the exported name.
// NOLINTNEXTLINE(readability-make-member-function-const)
bool HASocketComm::HasError() {
    return hasError;
}

int HASocketComm::Send(const std::string& data) {
    return static_cast<int>(
        sendto(sockFd, data.data(), data.size(), 0, asSockaddr(peerAddr), sizeof peerAddr));
}

HASocketCommServer::HASocketCommServer(const std::string& ip)
    : HASocketComm(ip), peerAddrLen(sizeof peerAddr) {
    if (!hasError) {
        hasError = bind(sockFd, asSockaddr(peerAddr), peerAddrLen) != 0;
    }
}

HASocketCommServer::HASocketCommServer(const std::string& ip, unsigned int timeoutSec)
    : HASocketComm(ip), peerAddrLen(sizeof peerAddr) {
    recvTimeout.seconds = timeoutSec;
    if (!hasError) {
        hasError = !setRecvTimeout(sockFd, recvTimeout.seconds) ||
                   bind(sockFd, asSockaddr(peerAddr), peerAddrLen) != 0;
    }
}

int HASocketCommServer::Recv(std::string& out) {
    peerAddr = {};
    peerAddrLen = sizeof peerAddr;
    Message message = {};
    const ssize_t received =
        recvfrom(sockFd, message.data(), message.size() - 1, 0, asSockaddr(peerAddr), &peerAddrLen);
    return takeMessage(received, message, out);
}

HASocketCommClient::HASocketCommClient(const std::string& ip, unsigned int timeoutSec) : HASocketComm(ip) {
    recvTimeout.seconds = timeoutSec;
    if (!hasError) {
        hasError = !setRecvTimeout(sockFd, recvTimeout.seconds);
    }
}

int HASocketCommClient::Recv(std::string& out) {
    Message message = {};
    // Frozen: docs/compatibility.md#any-sender
    const ssize_t received = recvfrom(sockFd, message.data(), message.size() - 1, 0, nullptr, nullptr);
    return takeMessage(received, message, out);
}
