#include "support/system_log.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdint>
#include <mutex>
#include <stdexcept>
#include <thread>

#include "support/descriptor.h"
#include "support/pattern.h"
#include "support/sandbox_check.h"
#include "support/wait.h"

namespace test {
namespace {

SystemLog::Entry parseEntry(std::string datagram) {
    while (!datagram.empty() && datagram.back() == '\0') {
        datagram.pop_back();
    }
    // "<11>Nov 20 22:00:00 ident: text"; the text may have several lines.
    static const Pattern kHeader(
        "^<([0-9]+)>[A-Z][a-z]{2} [ 0-9][0-9] [0-9]{2}:[0-9]{2}:[0-9]{2} ([^ :]+): ");
    const std::vector<std::string> header = kHeader.find(datagram);
    if (header.empty()) {
        return {-1, "", datagram};
    }
    return {std::stoi(header[1]), header[2], datagram.substr(header[0].size())};
}

Descriptor boundSocket(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        throw std::invalid_argument("too long for a socket: " + path);
    }
    path.copy(address.sun_path, path.size());
    Descriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0),
                      "cannot make a socket");
    unlink(path.c_str());
    if (bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == -1) {
        throw std::system_error(errno, std::generic_category(), "cannot bind " + path);
    }
    chmod(path.c_str(), 0666);
    return socket;
}

}  // namespace

struct SystemLog::Receiver {
    explicit Receiver(const std::string& logPath)
        : path(logPath), socket(boundSocket(logPath)), stop(eventfd(0, EFD_CLOEXEC), "cannot make an event") {
        thread = std::thread([this] { receive(); });
    }

    ~Receiver() {
        eventfd_write(stop.get(), 1);
        thread.join();
        unlink(path.c_str());
    }

    // Under the lock, so that nothing is between the socket and the entries while somebody looks.
    std::vector<Entry> drained() {
        const std::lock_guard lock(mutex);
        char datagram[16384];
        ssize_t length = 0;
        while ((length = recv(socket.get(), datagram, sizeof datagram, 0)) >= 0) {
            entries.push_back(parseEntry({datagram, static_cast<size_t>(length)}));
        }
        return entries;
    }

    void receive() {
        pollfd waited[] = {{socket.get(), POLLIN, 0}, {stop.get(), POLLIN, 0}};
        while (waited[1].revents == 0) {
            if (poll(waited, std::size(waited), -1) > 0 && waited[0].revents != 0) {
                drained();
            }
        }
    }

    std::string path;
    Descriptor socket;
    Descriptor stop;
    std::mutex mutex;
    std::vector<Entry> entries;
    std::thread thread;
};

SystemLog::SystemLog(const std::string& path) {
    requireSandbox();
    receiver_ = std::make_unique<Receiver>(path);
}

SystemLog::~SystemLog() = default;

std::vector<SystemLog::Entry> SystemLog::entries() {
    return receiver_->drained();
}

std::vector<std::string> SystemLog::texts() {
    std::vector<std::string> texts;
    for (Entry& entry : entries()) {
        texts.push_back(std::move(entry.text));
    }
    return texts;
}

bool SystemLog::waitFor(size_t count, std::chrono::milliseconds deadline) {
    return eventually(deadline, [&] { return entries().size() >= count; });
}

}  // namespace test
