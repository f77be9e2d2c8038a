/// @file
/// Requests and replies over a Unix socket.

#pragma once

#include <json/value.h>

#include <cstdint>
#include <string>

#pragma GCC visibility push(default)

namespace TERN::HA::Daemon {

/// A request and its reply over a Unix stream socket of this machine, each one JSON text in one send and one
/// receive of at most 2095 bytes. An object is either a server (serverBind once, then serverListen again and
/// again) or a client (clientSend once). A derived class gives the requests their meaning.
///
/// Failures are reported by the result and, at LOG_ERR, in the system log, whose identity and facility are
/// the host's; nothing throws. An object that failed to bind, listen or exchange refuses everything
/// afterwards: make a new one.
///
/// An object belongs to one thread at a time. There is no virtual destructor: destroy an object through its
/// own type.
class DaemonLocalSocket {
 public:
    /// `path`: of the socket file, cut to its first 107 characters. `timeout`: seconds that a client waits
    /// for its reply; 0 (or above 2147483647): for ever. Opens a socket; hasError() when there is none to be
    /// had.
    DaemonLocalSocket(std::string path, unsigned int timeout);
    ~DaemonLocalSocket();

    DaemonLocalSocket(const DaemonLocalSocket&) = delete;
    DaemonLocalSocket& operator=(const DaemonLocalSocket&) = delete;

    /// True after a failure that this object does not recover from.
    bool hasError();

    /// Makes the object a server: replaces the socket file at its path and listens, 100 connections waiting
    /// at most. The mode of the file follows the process's umask. True on success.
    bool serverBind();

    /// Waits, without bound or until a signal comes, for one connection, serves the one request that it
    /// carries and closes it. False when there was none to accept, it held no JSON, serverHandle refused it
    /// or the reply could not be sent; the next call may succeed all the same. Blocks in the receive for as
    /// long as the client keeps the connection open without sending.
    bool serverListen();

    /// Connects, sends `request` and waits up to the time-out for `reply`, which is left as it was on
    /// failure. True when a JSON text came back.
    bool clientSend(const Json::Value& request, Json::Value& reply);

    /// Answers `request` in `reply` (null when called). False sends nothing: the client sees the connection
    /// closed.
    virtual bool serverHandle(const Json::Value& request, Json::Value& reply) = 0;

 protected:
    /// Serves the connection `fd`: the second half of serverListen. The caller closes it.
    bool _serverListen(int fd);

    /// Sets the time-out and connects: the first half of clientSend.
    bool _clientConnect();

 private:
    std::string _path;
    std::uint32_t _timeout;  ///< seconds
    bool _hasError;
    int _fd;
    char _buffer[2096];
};

}  // namespace TERN::HA::Daemon

#pragma GCC visibility pop
