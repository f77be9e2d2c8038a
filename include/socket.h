/// @file
/// Local JSON socket: one request and one reply per connection over a Unix stream socket.

#pragma once

#include <json/value.h>

#include <cstdint>
#include <string>

#pragma GCC visibility push(default)

namespace TERN::HA::Daemon {

/// One end of a Unix stream socket that carries one JSON request and one JSON reply per connection.
/// Either text is sent by one send(2) and read by one recv(2) of at most 2095 bytes, without length
/// or terminator.
///
/// An object is either a server (call serverBind once, then serverListen in a loop) or a client
/// (call clientSend once). A derived class handles requests in serverHandle.
///
/// Operations report failure by their result and log it to the system log at LOG_ERR, under the
/// identity and facility that the host chose with openlog. None throws; running out of memory is a
/// failure like others. The error flag is sticky: after a failure to open, bind or listen, or of
/// clientSend, the object refuses every further serverListen and clientSend.
///
/// Not thread-safe: use an object from one thread at a time. The destructor is not virtual: destroy
/// an object through its own type.
class DaemonLocalSocket {
 public:
    /// Open the socket.
    ///
    /// @param path     of the socket file; cut to its first 107 characters
    /// @param timeout  receive timeout of a client, in seconds; 0 or above 2147483647: none
    ///
    /// hasError() is true when no socket could be opened.
    DaemonLocalSocket(std::string path, unsigned int timeout);
    ~DaemonLocalSocket();

    DaemonLocalSocket(const DaemonLocalSocket&) = delete;
    DaemonLocalSocket& operator=(const DaemonLocalSocket&) = delete;

    /// Return the error flag: true after a failure from which this object does not recover.
    bool hasError();

    /// Server: remove whatever file is at the path, bind it and listen with a backlog of 100. The
    /// file's mode follows the process's umask. Returns true on success. Does not block.
    bool serverBind();

    /// Server: accept one connection, serve its request and close it.
    ///
    /// Returns true when a reply was sent. Returns false when the accept failed or was interrupted
    /// by a signal, the request was not JSON, serverHandle refused it, or the reply could not be
    /// sent; none of these sets the error flag. Blocks without limit for a connection, and without
    /// limit for a client that connects and sends nothing.
    bool serverListen();

    /// Client: connect, send `request` and receive `reply`.
    ///
    /// Returns true when the reply was a JSON text; otherwise false, with `reply` unchanged. Blocks
    /// up to the timeout for the reply, and without limit while the server's backlog is full.
    bool clientSend(const Json::Value& request, Json::Value& reply);

    /// Server: carry out `request` and store the reply, null when called, in `reply`. Return true
    /// to send it; after false the connection is closed without a reply.
    virtual bool serverHandle(const Json::Value& request, Json::Value& reply) = 0;

 protected:
    /// Serve the request on the connected socket `fd`: the second half of serverListen. Does not
    /// close `fd`.
    bool _serverListen(int fd);

    /// Set the receive timeout and connect: the first half of clientSend.
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
