// Replies of the peer. The first byte selects the request.
#include <arpa/inet.h>
#include <dlfcn.h>
#include <json/value.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <array>

#include "checker.h"
#include "faults/real_function.h"
#include "fuzz/fuzz.h"

namespace {

std::string reply;

// The peer's socket. The reply is sent within the requester's sendto(): no thread, no wait.
int peerSocket() {
    static const int fd = [] {
        const int made = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_port = htons(7499);
        inet_pton(AF_INET, "127.0.0.2", &address.sin_addr);
        fuzz::require(bind(made, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0,
                      "the peer's port is free");
        return made;
    }();
    return fd;
}

}  // namespace

ssize_t sendto(int fd, const void* data, std::size_t size, int flags, const sockaddr* address,
               socklen_t length) {
    static auto* const realSendto =
        test::realFunction<ssize_t(int, const void*, std::size_t, int, const sockaddr*, socklen_t)>("sendto");
    peerSocket();
    const ssize_t sent = realSendto(fd, data, size, flags, address, length);
    std::array<char, 64> request;
    sockaddr_in from = {};
    socklen_t fromLength = sizeof from;
    recvfrom(peerSocket(), request.data(), request.size(), 0, reinterpret_cast<sockaddr*>(&from),
             &fromLength);
    realSendto(peerSocket(), reply.data(), reply.size(), 0, reinterpret_cast<sockaddr*>(&from), fromLength);
    return sent;
}

int LLVMFuzzerInitialize(int* /*argc*/, char*** /*argv*/) {
    fuzz::prepareLog();
    remoteIP("127.0.0.2");
    return 0;
}

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace TERN::HA::Daemon;
    if (size == 0 || size > 1000) {
        return 0;
    }
    reply = fuzz::text(data + 1, size - 1);
    const std::string arrived = reply.substr(0, 63).c_str();  // without what follows a zero byte
    switch (data[0] % 4) {
        case 0:
            fuzz::require(IsRemoteAlive()() == (arrived == "alive"), "only \"alive\" is alive");
            break;
        case 1:
            fuzz::require(IsRemoteMDResync()() == (arrived == "resync"), "only \"resync\" is a resync");
            break;
        case 2: {
            std::string name = "unchanged";
            fuzz::require(GetRemoteHostname()(name), "every reply is a name");
            fuzz::require(name == arrived, "the name is what arrived");
            break;
        }
        default: {
            const Json::Value before("unchanged");
            Json::Value disks = before;
            const bool isHandling = IsRemoteDiskErrHandling()(disks);
            fuzz::require(!isHandling || disks != before, "error handling comes with its disks");
            fuzz::require(!isHandling || arrived.find("isDiskErrHandling") != std::string::npos ||
                              arrived.find('\\') != std::string::npos,
                          "error handling is named");
        }
    }
    return 0;
}
