#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <string>
#include <thread>

#include "support/udp.h"

namespace test {

// A peer that answers the request.
class ObedientPeer {
 public:
    ObedientPeer()
        : _thread([this] {
              if (const auto question = _socket.receive(std::chrono::seconds(10))) {
                  _question = question->bytes;
                  _socket.send("", question->address, question->port);
              }
          }) {}

    ~ObedientPeer() {
        _thread.join();
        EXPECT_EQ(_question, "reboot_remote");
    }

    ObedientPeer(const ObedientPeer&) = delete;
    ObedientPeer& operator=(const ObedientPeer&) = delete;

 private:
    UdpSocket _socket{"127.0.0.2", 7499};
    std::string _question;
    std::thread _thread;
};

}  // namespace test
