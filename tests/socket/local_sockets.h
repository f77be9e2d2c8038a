#pragma once

#include <json/value.h>
#include <sys/resource.h>

#include <atomic>
#include <functional>
#include <string>
#include <thread>

#include "socket.h"
#include "support/descriptor.h"

// Both ends of the control socket for tests.
namespace test {

constexpr char LOCAL_SOCKET[] = "/tmp/control.sock";

// Replies by a function of the test.
class HandlerSocket final : public TERN::HA::Daemon::DaemonLocalSocket {
 public:
    using Handler = std::function<bool(const Json::Value& request, Json::Value& reply)>;

    explicit HandlerSocket(Handler handler = {}, std::string path = LOCAL_SOCKET, unsigned int timeout = 0)
        : DaemonLocalSocket(std::move(path), timeout), _handler(std::move(handler)) {}

    bool serverHandle(const Json::Value& request, Json::Value& reply) override {
        return _handler(request, reply);
    }

 private:
    Handler _handler;
};

// Serves in its own thread for the lifetime of the object.
class ServingThread {
 public:
    explicit ServingThread(TERN::HA::Daemon::DaemonLocalSocket& server, std::string path = LOCAL_SOCKET);
    ~ServingThread();

    ServingThread(const ServingThread&) = delete;
    ServingThread& operator=(const ServingThread&) = delete;

 private:
    std::string _path;
    std::atomic<bool> _isStopping{false};
    std::thread _thread;
};

// A client without the library.
class RawClient {
 public:
    // `flags` are added to the type of the socket. Throws std::system_error when it cannot connect.
    explicit RawClient(const std::string& path = LOCAL_SOCKET, int flags = 0);

    // Send; false when the server has closed its end.
    bool send(const std::string& bytes) const;

    // Return everything received until the server closes the connection.
    std::string receiveAll() const;

    // Shut down sending: the server reads end of file.
    void finish() const;

    void close();

 private:
    Descriptor _fd;
};

// Send one request and return the whole reply.
std::string exchange(const std::string& request);

// Listens and never replies.
class SilentServer {
 public:
    explicit SilentServer(const std::string& path = LOCAL_SOCKET);

    // Accept the next client and return what it has sent so far.
    std::string received() const;

    // Wait for a client's request and close the connection without reading it.
    void dropRequest() const;

 private:
    Descriptor _fd;
};

// Interrupts blocking calls with SIGALRM every 20 ms for the lifetime of the object.
class Interruptions {
 public:
    Interruptions();
    ~Interruptions();

    Interruptions(const Interruptions&) = delete;
    Interruptions& operator=(const Interruptions&) = delete;
};

// Makes opening of descriptors fail with EMFILE for the lifetime of the object.
class NoDescriptors {
 public:
    NoDescriptors();
    ~NoDescriptors();

    NoDescriptors(const NoDescriptors&) = delete;
    NoDescriptors& operator=(const NoDescriptors&) = delete;

 private:
    rlimit _limit;
};

}  // namespace test
