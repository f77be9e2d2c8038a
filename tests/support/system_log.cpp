#include "support/system_log.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <regex>

#include "support/wait.h"

namespace test {
namespace {

SystemLog::Entry parseEntry(std::string datagram) {
    datagram.erase(datagram.find_last_not_of('\0') + 1);
    // "<11>Nov 20 22:00:00 ident: text"; the text may have several lines.
    static const std::regex HEADER("^<(\\d+)>[A-Z][a-z]{2} [ \\d]\\d \\d\\d:\\d\\d:\\d\\d ([^ :]+): ");
    std::smatch header;
    if (!std::regex_search(datagram, header, HEADER)) {
        return {-1, "", datagram};
    }
    return {std::stoi(header[1]), header[2], header.suffix()};
}

Descriptor boundSocket(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    check(path.copy(address.sun_path, sizeof address.sun_path - 1) == path.size(), "too long: " + path);
    Descriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0), "cannot make a socket");
    unlink(path.c_str());
    check(bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0,
          "cannot bind " + path);
    chmod(path.c_str(), 0666);
    return socket;
}

}  // namespace

SystemLog::SystemLog(const std::string& path) : _path(path), _socket(boundSocket(path)) {
    _receiver = std::thread([this] {
        pollfd waited{_socket.get(), POLLIN, 0};
        while (!_isStopping) {
            if (poll(&waited, 1, 10) > 0) {
                entries();
            }
        }
    });
}

SystemLog::~SystemLog() {
    _isStopping = true;
    _receiver.join();
    unlink(_path.c_str());
}

// Received under the lock: readers then miss no datagram in flight.
std::vector<SystemLog::Entry> SystemLog::entries() {
    const std::lock_guard lock(_mutex);
    char datagram[16384];
    ssize_t length = 0;
    while ((length = recv(_socket.get(), datagram, sizeof datagram, MSG_DONTWAIT)) >= 0) {
        _entries.push_back(parseEntry({datagram, static_cast<std::size_t>(length)}));
    }
    return _entries;
}

std::vector<std::string> SystemLog::texts() {
    std::vector<std::string> texts;
    for (Entry& entry : entries()) {
        texts.push_back(std::move(entry.text));
    }
    return texts;
}

bool SystemLog::waitFor(std::size_t count, std::chrono::milliseconds deadline) {
    return eventually(deadline, [&] { return entries().size() >= count; });
}

}  // namespace test
