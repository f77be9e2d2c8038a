/// @file
/// The questions to the peer: their base, their registry, and the server that answers them.

#pragma once

#include <json/value.h>

#include <map>
#include <string>

namespace TERN::HA::Daemon {
class Status;
}

#pragma GCC visibility push(default)

/// A question that one node asks the other, with both its sides: the asking side (a call operator), run on
/// the node that wants to know, and the answering side (handle), run on the other node by SocketServer.
///
/// On the wire, UDP port HA_PEER_PORT: the question is the check's type name, the answer the string that
/// handle returned, each one datagram without terminator; 63 bytes at most arrive.
///
/// A check has no data members and no destructor of its own, and so may be deleted through an EnvCheck
/// pointer although there is no virtual destructor. Keep it that way in every check. Checks may be used from
/// any thread.
class EnvCheck {
 public:
    /// Asks the peer. This one does not ask and returns true.
    virtual bool operator()();

    /// Asks the peer, with the details of its answer in `out`. This one does not ask, leaves `out` as it is
    /// and returns true.
    virtual bool operator()(Json::Value& out);

    /// The answer of this node, from its `status`. This one answers "Undefine".
    virtual std::string handle(TERN::HA::Daemon::Status& status);

    /// The type name: the question on the wire and the key in the registry. Here "Undefine".
    virtual std::string getType();

 protected:
    /// One exchange with the node at remoteIP(""): sends getType() and puts the answer into `reply`. True
    /// when anything came back within 3 seconds, an empty answer included; otherwise false with `reply` as it
    /// was. Asks once, never again by itself. Blocks up to 3 seconds. Logs "Failed to start socket client"
    /// when it has no socket to ask with, and nothing else.
    bool _sendToRemote(std::string& reply);
};

/// The registry: how to make the check that a question names.
class CheckerFactory {
 public:
    /// From type name to function; null until the first registration. Filled while libraries are loaded, and
    /// only read, without a lock, afterwards. Never freed.
    static std::map<std::string, EnvCheck* (*)()>* opMap;
};

/// Makes a check of type T; the caller deletes it.
template <class T>
EnvCheck* createEnvCheckT() {
    return new T;
}

/// Registers T under a name for as long as the process lives. A name that is taken keeps its first owner. Use
/// it for static objects only: the registry is not locked.
template <class T>
class CheckerRegister {
 public:
    /// Registers T under `name`.
    explicit CheckerRegister(const std::string& name) {
        if (CheckerFactory::opMap == nullptr) {
            CheckerFactory::opMap = new std::map<std::string, EnvCheck* (*)()>;
        }
        CheckerFactory::opMap->emplace(name, &createEnvCheckT<T>);
    }
};

/// The answering end: one object, or several, in one thread of the host.
class SocketServer {
 public:
    /// Serves at most one question of the peer from `status` and returns true, whether or not one came.
    /// Blocks up to 30 seconds for it, less when a signal comes. Questions that arrive between two calls wait
    /// in the socket. The first call binds localIP(""), port HA_PEER_PORT, for the rest of the process.
    /// Returns false at once when that failed, in every call: the log then has "Failed to start socket
    /// server" and the system's error text. Logs "Failed to sendto" when an answer cannot be sent.
    ///
    /// A question that is no registered type name ends the process with SIGABRT, unanswered: only the peer
    /// speaks on this port, and a peer that speaks otherwise must not be taken for a working one.
    ///
    /// One thread only: all calls share one socket and the sender that it remembers.
    bool operator()(TERN::HA::Daemon::Status& status);
};

// Addresses of this process. A non-empty `value` replaces what is stored; the stored string, empty at first,
// is returned in every case. Set them before starting the threads that read them: they are not locked.
std::string drbdIF(const std::string& value);    ///< name of the network interface that carries DRBD
std::string localIP(const std::string& value);   ///< this node's IPv4 address, dotted quad
std::string remoteIP(const std::string& value);  ///< the peer's IPv4 address, dotted quad

#pragma GCC visibility pop
