/// @file
/// Peer checks: base class, registry, and the server that replies to them.

#pragma once

#include <json/value.h>

#include <map>
#include <string>

namespace TERN::HA::Daemon {
class Status;
}

#pragma GCC visibility push(default)

/// Base of all peer checks. A peer check is one request of the peer protocol with both its sides:
/// the requesting side (a call operator) runs on one node; the replying side (handle) runs on the
/// other, called by SocketServer.
///
/// On the wire (UDP, port HA_PEER_PORT) the request is the check's type name and the reply is the
/// string that handle returned: one datagram each, without terminator, of which the receiver reads
/// at most 63 bytes.
///
/// A check has no data members and no destructor of its own. That is what makes deleting it through
/// an EnvCheck pointer sound although the destructor is not virtual; keep it so in every derived
/// class.
///
/// Thread-safe: a check keeps no state, any thread may call it. No operation throws; running out of
/// memory counts as a missing reply.
class EnvCheck {
 public:
    /// Run the check against the peer. The base class sends nothing and returns true.
    virtual bool operator()();

    /// Run the check against the peer and store the details of its reply in `out`. The base class
    /// sends nothing, leaves `out` unchanged and returns true.
    virtual bool operator()(Json::Value& out);

    /// Return this node's reply, computed from its `status`. The base class returns "Undefine".
    virtual std::string handle(TERN::HA::Daemon::Status& status);

    /// Return the type name: the request on the wire and the key in the registry. The base class
    /// returns "Undefine", which no registry holds.
    virtual std::string getType();

 protected:
    /// Send getType() to the node at remoteIP("") and receive its reply.
    ///
    /// @param reply  receives the reply, 0 to 63 bytes; unchanged on failure
    /// @return true when a datagram arrived within 3 seconds, an empty one included; false on
    ///         timeout and on any error. Logs "Failed to start socket client" when no socket could
    ///         be opened or set up, and nothing for other failures.
    ///
    /// One attempt, no retransmission. Blocks for up to 3 seconds, less when a signal interrupts
    /// it.
    bool _sendToRemote(std::string& reply);
};

/// Registry of the peer checks: maps a request to the function that creates its check.
class CheckerFactory {
 public:
    /// Type name to factory function; the caller owns the check that the function returns. Null
    /// until the first registration. Filled by static initialisation; a host may replace entries
    /// before it starts threads. Not locked. Never freed.
    static std::map<std::string, EnvCheck* (*)()>* opMap;
};

/// Create a check of type T. The caller owns it.
template <class T>
EnvCheck* createEnvCheckT() {
    return new T;
}

/// Registers the check T while it is constructed. Use it for static objects only: the registry is
/// not locked.
template <class T>
class CheckerRegister {
 public:
    /// Register createEnvCheckT<T> under `name`, for the life of the process. A name that is
    /// already registered keeps its first factory.
    explicit CheckerRegister(const std::string& name) {
        if (CheckerFactory::opMap == nullptr) {
            CheckerFactory::opMap = new std::map<std::string, EnvCheck* (*)()>;
        }
        // Frozen: docs/compatibility.md#first-factory-wins
        CheckerFactory::opMap->emplace(name, &createEnvCheckT<T>);
    }
};

/// Server of the peer protocol. Stateless: all objects of a process share one server socket.
class SocketServer {
 public:
    /// Serve at most one request of the peer.
    ///
    /// The first call binds the server socket to localIP(""), port HA_PEER_PORT, for the life of
    /// the process. Requests that arrive between two calls queue up in the socket.
    ///
    /// @param status  the record from which replies are computed
    /// @return true, whether or not a request arrived; false when the server socket could not be
    ///         opened, set up or bound, logging "Failed to start socket server" directly followed by
    ///         the system's error text. Every later call then fails at once in the same way. A reply
    ///         that cannot be sent is logged as "Failed to sendto". A request is dropped when memory
    ///         runs out.
    ///
    /// A request that is not a registered type name aborts the process without a reply: only the
    /// peer speaks on this port, and a peer that speaks anything else must not be taken for a
    /// working one.
    ///
    /// Blocks for up to 30 seconds for a request, less when a signal interrupts it, and then for as
    /// long as the check's handle takes. Not thread-safe: call it from one thread only, because all
    /// calls share the socket and the sender that it remembers.
    bool operator()(TERN::HA::Daemon::Status& status);
};

// Addresses of this process. A non-empty `value` replaces the stored string; an empty one only
// reads it. Return the stored string, which is empty at first. Not thread-safe: set them before the
// threads that read them are started.
std::string drbdIF(const std::string& value);    ///< name of the network interface that carries DRBD
std::string localIP(const std::string& value);   ///< this node's IPv4 address, dotted quad
std::string remoteIP(const std::string& value);  ///< the peer's IPv4 address, dotted quad

#pragma GCC visibility pop
