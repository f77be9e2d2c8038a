#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <string>
#include <thread>
#include <utility>

#include "support/udp.h"

namespace test {

// A stub peer that calls `onRequest` and replies to the request if that returns true.
class ObedientPeer {
 public:
    explicit ObedientPeer(std::function<bool()> onRequest = [] { return true; })
        : _onRequest(std::move(onRequest)), _thread([this] {
              if (const auto request = _socket.receive(std::chrono::seconds(10))) {
                  _request = request->bytes;
                  if (_onRequest()) {
                      _socket.send("", request->address, request->port);
                  }
              }
          }) {}

    ~ObedientPeer() {
        _thread.join();
        EXPECT_EQ(_request, "reboot_remote");
    }

    ObedientPeer(const ObedientPeer&) = delete;
    ObedientPeer& operator=(const ObedientPeer&) = delete;

 private:
    std::function<bool()> _onRequest;
    UdpSocket _socket{"127.0.0.2", 7499};
    std::string _request;
    std::thread _thread;
};

}  // namespace test
