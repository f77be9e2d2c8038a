#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "support/udp.h"

namespace test {

// The other end of the peer protocol, at 127.0.0.2, with replies that a test sets. Well at first.
class PlayedPeer {
 public:
    PlayedPeer() : _socket("127.0.0.2", 7499), _thread([this] { serve(); }) {}
    ~PlayedPeer() {
        _isStopping = true;
        UdpSocket("127.0.0.2").send("", "127.0.0.2", 7499);
        _thread.join();
    }

    PlayedPeer(const PlayedPeer&) = delete;
    PlayedPeer& operator=(const PlayedPeer&) = delete;

    void setReply(const std::string& request, const std::string& reply) {
        const std::lock_guard<std::mutex> lock(_mutex);
        _replies[request] = reply;
    }

    // From now on the request gets no reply.
    void ignore(const std::string& request) {
        const std::lock_guard<std::mutex> lock(_mutex);
        _replies.erase(request);
    }

    // At the next request of this kind it falls silent.
    void dieAt(const std::string& request) {
        const std::lock_guard<std::mutex> lock(_mutex);
        _lastRequest = request;
    }

    // The reply to that request, which was under way for so long.
    void replyLate(const std::string& reply) {
        const std::lock_guard<std::mutex> lock(_mutex);
        _socket.send(reply, _unanswered.value().address, _unanswered.value().port);
    }

 private:
    static bool isKnown(const std::string& request) {
        return request.empty() || request == "is_alive" || request == "is_md_resync" ||
               request == "is_disk_err_handling" || request == "remote_hostname" ||
               request == "reboot_remote";
    }

    void serve() {
        while (!_isStopping) {
            const auto request = _socket.receive(std::chrono::minutes(1));
            if (!request) {
                continue;
            }
            // Would abort a real peer. The empty one is the end.
            EXPECT_TRUE(isKnown(request->bytes)) << testing::PrintToString(request->bytes);
            const std::lock_guard<std::mutex> lock(_mutex);
            if (!_unanswered && request->bytes == _lastRequest) {
                _unanswered = request;
            }
            const auto reply = _replies.find(request->bytes);
            if (reply != _replies.end() && !_unanswered) {
                _socket.send(reply->second, request->address, request->port);
            }
        }
    }

    std::mutex _mutex;
    std::map<std::string, std::string> _replies = {
        {"is_alive", "alive"},
        {"is_md_resync", "not_resync"},
        {"remote_hostname", "node-b\n"},
        {"is_disk_err_handling", R"({"errHandlingDisk":[],"isDiskErrHandling":false})"}};
    std::string _lastRequest;
    std::optional<Datagram> _unanswered;
    std::atomic<bool> _isStopping{false};
    UdpSocket _socket;
    std::thread _thread;
};

}  // namespace test
