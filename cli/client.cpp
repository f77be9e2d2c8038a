#include "client.h"

#include <json/reader.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <memory>

namespace ternhactl {

namespace {

constexpr char NOT_TERNHADS[] = "the reply is not ternhad's";
constexpr std::size_t LONGEST_REPLY = std::size_t{256} * 1024;
constexpr char NO_REPLY[] = "the connection was closed without a reply";

[[noreturn]] void failWithError() {
    throw NoAnswer(std::strerror(errno));
}

Json::Value parse(const std::string& text) {
    if (text.rfind(REFUSAL, 0) == 0) {
        throw Refused(text);
    }
    const std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
    Json::Value value;
    try {
        if (reader->parse(text.data(), text.data() + text.size(), &value, nullptr)) {
            return value;
        }
    } catch (const Json::Exception&) {
        // Nested deeper than the parser's limit.
    }
    throw NoAnswer(NOT_TERNHADS);
}

int connectedSocket(const Settings& settings, const Deadline& deadline) {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    if (settings.socket.size() >= sizeof address.sun_path) {
        throw NoAnswer("longer than 107 characters");
    }
    settings.socket.copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        failWithError();
    }
    // Also limits the wait for the backlog. 0 would mean no limit.
    const auto rest =
        std::chrono::duration_cast<std::chrono::microseconds>(deadline.time - Deadline::Clock::now());
    const auto limit = std::max(rest, std::chrono::microseconds(1)).count();
    timeval timeout = {};
    timeout.tv_sec = limit / 1000000;
    timeout.tv_usec = limit % 1000000;
    setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof timeout);
    if (connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        const int error = errno;
        close(fd);
        errno = error;
        failWithError();
    }
    return fd;
}

}  // namespace

Connection::Connection(const Settings& settings, const std::string& action, const Deadline& deadline)
    : _fd(connectedSocket(settings, deadline)) {
    const std::string request = R"({"act":")" + action + "\"}";
    if (send(_fd, request.data(), request.size(), MSG_NOSIGNAL) < 0) {
        const int error = errno;
        close(_fd);
        throw Refused(std::strerror(error));
    }
}

Connection::~Connection() {
    close(_fd);
}

Connection::Input Connection::receive(Clock::time_point deadline) {
    for (;;) {
        const auto rest = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now()).count();
        constexpr decltype(rest) LONGEST = 1000000;
        pollfd input = {_fd, POLLIN, 0};
        const int ready = poll(&input, 1, static_cast<int>(std::clamp<decltype(+rest)>(rest, 0, LONGEST)));
        if (ready == 0 && Clock::now() >= deadline) {
            return Input::Timeout;
        }
        if (ready > 0) {
            std::array<char, 4096> part = {};
            const ssize_t count = recv(_fd, part.data(), part.size(), 0);
            if (count < 0) {
                failWithError();
            }
            _buffer.append(part.data(), static_cast<std::size_t>(count));
            if (_buffer.size() > LONGEST_REPLY) {
                throw NoAnswer(NOT_TERNHADS);  // an endless reply would also prevent the timeout
            }
            return count > 0 ? Input::Data : Input::End;
        }
        if (ready < 0 && errno != EINTR) {
            failWithError();
        }
    }
}

std::optional<Json::Value> Connection::reply(Clock::time_point deadline) {
    for (;;) {
        switch (receive(deadline)) {
            case Input::Data:
                break;
            case Input::Timeout:
                return std::nullopt;
            case Input::End:
                if (_buffer.empty()) {
                    throw Refused(NO_REPLY);
                }
                return parse(_buffer);
        }
    }
}

std::optional<Json::Value> Connection::line(Clock::time_point deadline) {
    std::size_t end = 0;
    while ((end = _buffer.find('\n')) == std::string::npos) {
        switch (receive(deadline)) {
            case Input::Data:
                break;
            case Input::Timeout:
                return std::nullopt;
            case Input::End:
                if (!_buffer.empty()) {
                    return parse(_buffer);
                }
                throw Refused("the connection was closed");
        }
    }
    const std::string text = _buffer.substr(0, end);
    _buffer.erase(0, end + 1);
    return parse(text);
}

Json::Value ask(const Settings& settings, const std::string& action, const Deadline& deadline) {
    Connection connection(settings, action, deadline);
    auto reply = connection.reply(deadline.time);
    if (!reply) {
        throw NoAnswer("no reply within " + std::to_string(deadline.seconds) + " s");
    }
    return *reply;
}

}  // namespace ternhactl
