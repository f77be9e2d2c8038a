#include "event_streams.h"

#include <json/writer.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <utility>

#include "passes.h"

namespace ternhad {

namespace {

constexpr std::size_t MOST_FOLLOWERS = 16;

std::string lineOf(const Json::Value& value) {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    return Json::writeString(builder, value) + '\n';
}

}  // namespace

EventStreams::~EventStreams() {
    for (const int fd : _clients) {
        close(fd);
    }
    for (const int fd : _new) {
        close(fd);
    }
}

bool EventStreams::add(int fd) {
    const std::lock_guard<std::mutex> lock(_mutex);
    if (_count == MOST_FOLLOWERS) {
        return false;
    }
    _new.push_back(fd);
    ++_count;
    _added.set();
    return true;
}

void EventStreams::run() {
    Passes passes;
    while (!_shutdown.isRequested()) {
        passes.run([this] {
            sendChanges();
            greetNewClients();
            wait();
            dropClosedClients();
        });
    }
}

void EventStreams::sendChanges() {
    _reader.event().take();
    std::uint64_t lost = 0;
    while (const auto transition = _reader.next(lost)) {
        const std::string line =
            (lost > 0 ? lineOf(Reporter::lostEvents(lost)) : "") + lineOf(Reporter::event(*transition));
        for (int& fd : _clients) {
            sendTo(fd, line);
        }
    }
}

void EventStreams::greetNewClients() {
    std::vector<int> added;
    _added.take();
    {
        const std::lock_guard<std::mutex> lock(_mutex);
        added.swap(_new);
    }
    if (added.empty()) {
        return;
    }
    const std::string line = lineOf(_reporter.report());
    for (int& fd : added) {
        sendTo(fd, line);
    }
    _clients.insert(_clients.end(), added.begin(), added.end());
}

// Send `line`; close the connection of a client that does not read.
void EventStreams::sendTo(int& fd, const std::string& line) {
    if (fd >= 0 && send(fd, line.data(), line.size(), MSG_NOSIGNAL | MSG_DONTWAIT) !=
                       static_cast<ssize_t>(line.size())) {
        close(std::exchange(fd, -1));
    }
}

void EventStreams::wait() {
    std::vector<pollfd> waits = {
        {_shutdown.event().fd(), POLLIN, 0}, {_reader.event().fd(), POLLIN, 0}, {_added.fd(), POLLIN, 0}};
    for (const int fd : _clients) {
        waits.push_back({fd, POLLIN, 0});
    }
    poll(waits.data(), waits.size(), -1);
}

// Anything that a client sends ends its connection, as a disconnect does.
void EventStreams::dropClosedClients() {
    for (int& fd : _clients) {
        pollfd state = {fd, POLLIN, 0};
        if (fd >= 0 && poll(&state, 1, 0) > 0) {
            close(std::exchange(fd, -1));
        }
    }
    const auto gone = std::remove(_clients.begin(), _clients.end(), -1);
    const auto count = static_cast<std::size_t>(_clients.end() - gone);
    _clients.erase(gone, _clients.end());
    const std::lock_guard<std::mutex> lock(_mutex);
    _count -= count;
}

}  // namespace ternhad
