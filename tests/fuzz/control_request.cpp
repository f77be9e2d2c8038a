// Requests over a real control socket.
#include <json/json.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <sstream>

#include "control.h"
#include "env_check.h"
#include "fuzz/fuzz.h"

namespace {

using namespace TERN::HA::Daemon;

constexpr char SOCKET[] = "/tmp/control.sock";

Status status;

MonitordSocket& server() {
    static MonitordSocket instance(SOCKET, 0);
    return instance;
}

}  // namespace

int LLVMFuzzerInitialize(int* /*argc*/, char*** /*argv*/) {
    fuzz::prepareLog();
    server().setStatus(&status);
    fuzz::require(server().serverBind(), "the socket can be bound");
    return 0;
}

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    // An empty request would block, and a reboot request waits for the peer.
    if (size == 0 || size > 4000 || fuzz::text(data, size).find('R') != std::string::npos ||
        fuzz::text(data, size).find('\\') != std::string::npos) {
        return 0;
    }
    const int client = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address = {AF_UNIX, {}};
    std::string(SOCKET).copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
    fuzz::require(connect(client, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0,
                  "the server is there");
    fuzz::require(send(client, data, size, MSG_NOSIGNAL) == static_cast<ssize_t>(size), "the request fits");
    const bool isServed = server().serverListen();
    std::array<char, 4096> buffer;
    std::string reply;
    ssize_t count = 0;
    while ((count = recv(client, buffer.data(), buffer.size(), 0)) > 0) {
        reply.append(buffer.data(), static_cast<std::size_t>(count));
    }
    close(client);

    fuzz::require(!server().hasError(), "no request breaks the server");
    fuzz::require(isServed != reply.empty(), "who is served gets a reply, and nobody else");
    if (isServed) {
        Json::Value value;
        std::istringstream stream(reply);
        fuzz::require(Json::parseFromStream(Json::CharReaderBuilder(), stream, &value, nullptr) &&
                          (value.isObject() || value.isNull()),
                      "a reply is one JSON text");
    }
    return 0;
}
