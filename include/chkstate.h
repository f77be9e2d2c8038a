/// @file
/// The datagrams of the peer protocol.

#pragma once

#include <netinet/in.h>
#include <sys/socket.h>

#include <cstdint>
#include <string>

#pragma GCC visibility push(default)

/// The UDP port on which every node answers its peer.
constexpr std::uint16_t HA_PEER_PORT = 7499;

/// One short text datagram over UDP/IPv4 as a question, one as the answer.
///
/// An object belongs to one thread at a time and owns its socket. Create a server or a client; this base
/// holds what both share. There is no virtual destructor: destroy an object through its own type.
class HASocketComm {
 public:
    /// Opens the socket and takes `ip` (dotted quad) and HA_PEER_PORT as the peer's address. A string that is
    /// not a dotted quad counts as 0.0.0.0. When no socket can be had, HasError() is true and the system log
    /// says so.
    explicit HASocketComm(const std::string& ip);
    ~HASocketComm();

    HASocketComm(const HASocketComm&) = delete;
    HASocketComm& operator=(const HASocketComm&) = delete;

    /// True when the construction failed; errno then tells why, until something else changes it. Calls on
    /// such an object fail like those on any bad socket.
    bool HasError();

    /// Sends the bytes of `data` as one datagram, without a terminating zero: a client to its peer, a server
    /// to the sender of the datagram that it received last (before the first one: to its own address).
    /// Returns the number of bytes sent, -1 on failure.
    int Send(const std::string& data);

    /// Receives one datagram into `out` and returns the number of bytes received, 0 for an empty datagram. At
    /// most 63 bytes are read, the rest of a longer datagram is lost, and `out` ends before the first zero
    /// byte. Returns -1 and leaves `out` as it was when the time-out ran out, a signal came or the receive
    /// failed. Blocks up to the receive time-out, without one until a datagram comes.
    virtual int Recv(std::string& out) = 0;

 protected:
    /// A time-out. Not a timeval, whose size depends on the including program's choice of time_t.
    struct TimeValue {
        std::uint32_t seconds;      ///< whole seconds
        std::int32_t microseconds;  ///< and the rest
    };

    int sockFd;             ///< the socket; -1 when there is none to be had
    sockaddr_in peerAddr;   ///< where Send goes: the peer, for a server the sender of what it received last
    TimeValue recvTimeout;  ///< of the socket; 0: none
    bool hasError;          ///< see HasError()
};

/// Bound to `ip`, port HA_PEER_PORT: receives questions and answers whoever asked last.
class HASocketCommServer : public HASocketComm {
 public:
    /// Without a receive time-out. HasError() when the address cannot be bound.
    explicit HASocketCommServer(const std::string& ip);

    /// With a receive time-out of `timeoutSec` seconds (0: none).
    HASocketCommServer(const std::string& ip, unsigned int timeoutSec);

    int Recv(std::string& out) override;

 private:
    socklen_t peerAddrLen;
};

/// Asks the node at `ip`. The system picks the source port at the first Send; any datagram that reaches this
/// port counts as the answer.
class HASocketCommClient : public HASocketComm {
 public:
    /// With a receive time-out of `timeoutSec` seconds (0: none).
    HASocketCommClient(const std::string& ip, unsigned int timeoutSec);

    int Recv(std::string& out) override;
};

#pragma GCC visibility pop
