#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "support/descriptor.h"

namespace test {

struct Datagram {
    std::string bytes;
    std::string address;  ///< sender, as a dotted quad
    uint16_t port = 0;    ///< sender
};

/// A UDP socket over IPv4. Failures throw std::system_error.
class UdpSocket {
 public:
    /// Bind to an address of this network namespace; port 0 selects a free one.
    explicit UdpSocket(const std::string& address = "127.0.0.1", uint16_t port = 0);

    uint16_t port() const;

    void send(const std::string& bytes, const std::string& address, uint16_t port);

    /// Return the next datagram, or nothing if none arrives before the deadline.
    std::optional<Datagram> receive(std::chrono::milliseconds deadline);

 private:
    Descriptor _socket;
};

}  // namespace test
