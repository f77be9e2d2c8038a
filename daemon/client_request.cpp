#include "client_request.h"

#include <json/json.h>
#include <sys/socket.h>

#include <array>
#include <memory>
#include <string>

namespace ternhad {

namespace {

constexpr std::size_t REQUEST_SIZE = 2096;  // the library reads as much

}  // namespace

char actionOf(int fd) try {
    std::array<char, REQUEST_SIZE> text;
    const ssize_t size = recv(fd, text.data(), text.size(), MSG_PEEK);
    Json::Value request;
    std::string errors;
    const std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
    const bool isRead = size > 0 && reader->parse(text.data(), text.data() + size, &request, &errors) &&
                        request.isObject() && request["act"].isString();
    return isRead ? request["act"].asString()[0] : '\0';
} catch (const Json::Exception&) {
    return '\0';  // nested past the parser's limit
}

void discardRequest(int fd) {
    std::array<char, REQUEST_SIZE> text;
    (void)recv(fd, text.data(), text.size(), 0);
}

void refuse(int fd, const char* reason) {
    discardRequest(fd);
    const std::string text = std::string("refused: ") + reason;
    send(fd, text.data(), text.size(), MSG_NOSIGNAL);
}

}  // namespace ternhad
