#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <array>
#include <cstdlib>
#include <string>

#include "support/descriptor.h"

namespace test {

// The service manager's end: the socket that services send their state to, named in this process's
// environment.
class ServiceManager {
 public:
    ServiceManager() {
        sockaddr_un address = {};
        address.sun_family = AF_UNIX;
        std::string(ADDRESS).copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
        EXPECT_EQ(bind(_socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
        setenv("NOTIFY_SOCKET", ADDRESS, 1);
    }

    // The next thing that it was told, and nothing when there is none.
    std::string told() {
        std::array<char, 256> buffer = {};
        const ssize_t size = recv(_socket.get(), buffer.data(), buffer.size(), MSG_DONTWAIT);
        return size > 0 ? std::string(buffer.data(), static_cast<std::size_t>(size)) : std::string();
    }

 private:
    static constexpr char ADDRESS[] = "/tmp/notify.sock";

    Descriptor _socket{socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0), "cannot make a socket"};
};

}  // namespace test
