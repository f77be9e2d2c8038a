#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <string>
#include <thread>
#include <utility>

#include "support/udp.h"

namespace test {

// A peer that answers the request after calling `onRequest`, unless that returns false.
class ObedientPeer {
 public:
    explicit ObedientPeer(std::function<bool()> onRequest = [] { return true; })
        : _onRequest(std::move(onRequest)), _thread([this] {
              if (const auto question = _socket.receive(std::chrono::seconds(10))) {
                  _question = question->bytes;
                  if (_onRequest()) {
                      _socket.send("", question->address, question->port);
                  }
              }
          }) {}

    ~ObedientPeer() {
        _thread.join();
        EXPECT_EQ(_question, "reboot_remote");
    }

    ObedientPeer(const ObedientPeer&) = delete;
    ObedientPeer& operator=(const ObedientPeer&) = delete;

 private:
    std::function<bool()> _onRequest;
    UdpSocket _socket{"127.0.0.2", 7499};
    std::string _question;
    std::thread _thread;
};

}  // namespace test
