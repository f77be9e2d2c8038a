#pragma once

#include <json/value.h>
#include <sys/resource.h>

#include <atomic>
#include <functional>
#include <string>
#include <thread>

#include "socket.h"
#include "support/descriptor.h"

// Both ends of the control socket as tests see them.
namespace test {

constexpr char LOCAL_SOCKET[] = "/tmp/control.sock";

// Answers by a function of the test.
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

// Serves in a thread of its own until the object goes.
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

// The bare client's end.
class RawClient {
 public:
    // `flags` are added to the type of the socket. Throws std::system_error when it cannot connect.
    explicit RawClient(const std::string& path = LOCAL_SOCKET, int flags = 0);

    // Sends; false when the server has closed its end.
    bool send(const std::string& bytes) const;

    // What comes until the server closes the connection.
    std::string receiveAll() const;

    // Ends its sending; the server reads an end of file.
    void finish() const;

    void close();

 private:
    Descriptor _fd;
};

// Sends one request and returns the whole answer.
std::string exchange(const std::string& request);

// Listens without ever answering.
class SilentServer {
 public:
    explicit SilentServer(const std::string& path = LOCAL_SOCKET);

    // What the next client has sent, up to now or, when it has left, in all.
    std::string received() const;

    // Waits for a client's request and closes the connection without having read it.
    void dropRequest() const;

 private:
    Descriptor _fd;
};

// While the object lives, SIGALRM comes every few milliseconds and interrupts what waits.
class Interruptions {
 public:
    Interruptions();
    ~Interruptions();

    Interruptions(const Interruptions&) = delete;
    Interruptions& operator=(const Interruptions&) = delete;
};

// While the object lives, no new descriptor is to be had.
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
