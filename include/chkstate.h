/// @file
/// Datagram transport of the peer protocol.

#pragma once

#include <netinet/in.h>
#include <sys/socket.h>

#include <cstdint>
#include <string>

#pragma GCC visibility push(default)

/// UDP port on which every node receives the requests of its peer.
constexpr std::uint16_t HA_PEER_PORT = 7499;

/// Transport for one request and one reply, each a short text datagram over UDP/IPv4. Base of
/// server and client; owns its socket.
///
/// Not thread-safe: use an object from one thread at a time. The destructor is not virtual: destroy
/// an object through its own type.
class HASocketComm {
 public:
    /// Open the socket and set the peer's address.
    ///
    /// @param ip  the peer's IPv4 address, dotted quad; anything else counts as 0.0.0.0. The port
    ///            is HA_PEER_PORT.
    ///
    /// HasError() is true when no socket could be opened; the system log then has "Failed to set
    /// socket".
    explicit HASocketComm(const std::string& ip);
    ~HASocketComm();

    HASocketComm(const HASocketComm&) = delete;
    HASocketComm& operator=(const HASocketComm&) = delete;

    /// Return true when the construction failed; errno has the reason right after it. Do not call
    /// Send and Recv then: without a socket they return -1, with one that could not be set up Recv
    /// may block.
    bool HasError();

    /// Send `data` as one datagram, without a terminating zero. A client sends to its peer. A
    /// server sends to the sender of the last datagram received; before the first Recv it sends to
    /// its own address, and after a failed Recv it fails.
    ///
    /// @return the number of bytes sent, -1 on failure. Does not wait for the peer.
    int Send(const std::string& data);

    /// Receive one datagram.
    ///
    /// @param out  receives the text up to the first zero byte; at most 63 bytes of the datagram
    ///             are read, the rest is discarded. Unchanged on failure.
    /// @return the number of bytes received, 0 for an empty datagram, -1 on timeout, interruption
    ///         by a signal or any other failure. Blocks up to the receive timeout; without one,
    ///         until a datagram arrives.
    virtual int Recv(std::string& out) = 0;

 protected:
    /// A timeout. Not a timeval, whose size depends on the including program's choice of time_t.
    struct TimeValue {
        std::uint32_t seconds;      ///< whole seconds
        std::int32_t microseconds;  ///< remainder, 0 to 999999
    };

    int sockFd;             ///< the socket; -1 when it could not be opened
    sockaddr_in peerAddr;   ///< destination of Send
    TimeValue recvTimeout;  ///< receive timeout of the socket; 0: none
    bool hasError;          ///< see HasError()
};

/// Server end: bound to this node's address, replies to the sender of the last request.
class HASocketCommServer : public HASocketComm {
 public:
    /// Bind the socket to `ip`, port HA_PEER_PORT, without a receive timeout. HasError() is true
    /// when the address cannot be bound.
    explicit HASocketCommServer(const std::string& ip);

    /// The same, with a receive timeout of `timeoutSec` seconds (0: none).
    HASocketCommServer(const std::string& ip, unsigned int timeoutSec);

    int Recv(std::string& out) override;

 private:
    socklen_t peerAddrLen;
};

/// Client end: sends requests to the node at `ip`. The kernel picks the source port at the first
/// Send. Recv accepts any datagram that reaches this port as the reply, from any sender.
class HASocketCommClient : public HASocketComm {
 public:
    /// Open a client with a receive timeout of `timeoutSec` seconds (0: none).
    HASocketCommClient(const std::string& ip, unsigned int timeoutSec);

    int Recv(std::string& out) override;
};

#pragma GCC visibility pop
