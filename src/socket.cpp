#include "socket.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstddef>
#include <cstring>
#include <new>
#include <utility>

#include "ha_log.h"
#include "json_text.h"

namespace TERN::HA::Daemon {

namespace {

constexpr int BACKLOG = 100;
constexpr std::size_t PATH_LIMIT = sizeof(sockaddr_un::sun_path) - 1;

struct Address {
    explicit Address(const std::string& path) : name() {
        name.sun_family = AF_UNIX;
        // Frozen: docs/compatibility.md#cut-path
        const std::size_t length = path.copy(static_cast<char*>(name.sun_path), PATH_LIMIT);
        size = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + length);
    }

    const sockaddr* get() const { return reinterpret_cast<const sockaddr*>(&name); }

    sockaddr_un name;
    socklen_t size;
};

class Connection {
 public:
    explicit Connection(int fd) : _fd(fd) {}
    ~Connection() { close(_fd); }

    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;

 private:
    int _fd;
};

// Send once. SIGPIPE from a closed connection must neither end the process nor reach the host's
// handler: block it in this thread, and consume it if this send raised it.
ssize_t sendText(int fd, const std::string& text) {
    sigset_t pipeSignal = {};
    sigset_t pending = {};
    sigset_t oldMask;
    sigaddset(&pipeSignal, SIGPIPE);
    sigpending(&pending);
    const bool wasPending = sigismember(&pending, SIGPIPE) == 1;
    pthread_sigmask(SIG_BLOCK, &pipeSignal, &oldMask);

    const ssize_t sent = send(fd, text.data(), text.size(), 0);
    if (sent == -1 && errno == EPIPE && !wasPending) {
        const timespec now = {};
        sigtimedwait(&pipeSignal, nullptr, &now);
    }
    pthread_sigmask(SIG_SETMASK, &oldMask, nullptr);
    return sent;
}

bool serverOutOfMemory(const char* request) {
    syslog(LOG_ERR, "%s:%d Failed to handle input data: %s", __FILE_NAME__, __LINE__, request);
    return false;
}

}  // namespace

DaemonLocalSocket::DaemonLocalSocket(std::string path, unsigned int timeout)
    : _path(std::move(path)),
      _timeout(timeout),
      _hasError(false),
      _fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)),
      _buffer() {
    if (_fd == -1) {
        _hasError = true;
        syslog(LOG_ERR, "%s:%d Failed to set socket", __FILE_NAME__, __LINE__);
    }
}

DaemonLocalSocket::~DaemonLocalSocket() {
    if (_fd != -1) {
        close(_fd);
    }
}

// Not const: the qualifier would be part of the exported name.
// NOLINTNEXTLINE(readability-make-member-function-const)
bool DaemonLocalSocket::hasError() {
    return _hasError;
}

bool DaemonLocalSocket::serverBind() {
    const Address address(_path);
    unlink(static_cast<const char*>(address.name.sun_path));  // left by an earlier server
    if (bind(_fd, address.get(), address.size) == -1) {
        syslog(LOG_ERR, "%s:%d Failed to bind socket %s: %m", __FILE_NAME__, __LINE__, _path.c_str());
        _hasError = true;
        return false;
    }
    if (listen(_fd, BACKLOG) == -1) {
        syslog(LOG_ERR, "%s:%d Failed to set listen: %m", __FILE_NAME__, __LINE__);
        _hasError = true;
        return false;
    }
    return true;
}

bool DaemonLocalSocket::serverListen() {
    if (_hasError) {
        // Frozen: docs/compatibility.md#shared-error-text
        syslog(LOG_ERR, "%s:%d Failed to send content: has error", __FILE_NAME__, __LINE__);
        return false;
    }
    const int fd = accept4(_fd, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd == -1) {
        syslog(LOG_ERR, "%s:%d Failed to accept: %m", __FILE_NAME__, __LINE__);
        return false;
    }
    const Connection connection(fd);
    return _serverListen(fd);
}

bool DaemonLocalSocket::_serverListen(int fd) try {
    std::fill(std::begin(_buffer), std::end(_buffer), '\0');
    if (recv(fd, _buffer, sizeof _buffer - 1, 0) == -1) {
        syslog(LOG_ERR, "%s:%d Failed to recv: %m", __FILE_NAME__, __LINE__);
        return false;
    }
    const char* const text = static_cast<const char*>(_buffer);
    Json::Value request;
    if (!parseJson(text, request)) {
        syslog(LOG_ERR, "%s:%d Failed to parse %s, %m", __FILE_NAME__, __LINE__, text);
        return false;
    }
    Json::Value reply;
    if (!serverHandle(request, reply)) {
        syslog(LOG_ERR, "%s:%d Failed to handle input data: %s", __FILE_NAME__, __LINE__, text);
        return false;
    }
    const std::string replyText = jsonText(reply);
    if (sendText(fd, replyText) == -1) {
        syslog(LOG_ERR, "%s:%d Failed to send output data: %m", __FILE_NAME__, __LINE__);
        syslog(LOG_ERR, "%s:%d Data: %s", __FILE_NAME__, __LINE__, replyText.c_str());
        return false;
    }
    return true;
} catch (const std::bad_alloc&) {
    return serverOutOfMemory(static_cast<const char*>(_buffer));
} catch (const JsonOutOfMemory&) {
    return serverOutOfMemory(static_cast<const char*>(_buffer));
}

bool DaemonLocalSocket::_clientConnect() {
    if (static_cast<std::int32_t>(_timeout) >= 1) {
        timeval timeout = {};
        timeout.tv_sec = _timeout;
        if (setsockopt(_fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout) == -1) {
            const int error = errno;
            syslog(LOG_ERR, "%s:%d Failed to set socket timeout", __FILE_NAME__, __LINE__);
            errno = error;  // for the caller's own line
            _hasError = true;
            return false;
        }
    }
    const Address address(_path);
    if (connect(_fd, address.get(), address.size) == -1) {
        const int error = errno;
        syslog(LOG_ERR, "%s:%d Failed to connect socket %s: %m", __FILE_NAME__, __LINE__, _path.c_str());
        errno = error;  // for the caller's own line
        _hasError = true;
        return false;
    }
    return true;
}

bool DaemonLocalSocket::clientSend(const Json::Value& request, Json::Value& reply) try {
    if (_hasError) {
        syslog(LOG_ERR, "%s:%d Failed to send content: has error", __FILE_NAME__, __LINE__);
        return false;
    }
    if (!_clientConnect()) {
        syslog(LOG_ERR, "%s:%d Failed to connect socket server: %m", __FILE_NAME__, __LINE__);
        return false;
    }
    const std::string requestText = jsonText(request);
    if (sendText(_fd, requestText) == -1) {
        syslog(LOG_ERR, "%s:%d Failed to send content: %s", __FILE_NAME__, __LINE__, requestText.c_str());
        _hasError = true;
        return false;
    }
    std::fill(std::begin(_buffer), std::end(_buffer), '\0');
    const char* const text = static_cast<const char*>(_buffer);
    if (recv(_fd, _buffer, sizeof _buffer - 1, 0) == -1) {
        syslog(LOG_ERR, "%s:%d Failed to recv %s, %m", __FILE_NAME__, __LINE__, text);
        _hasError = true;
        return false;
    }
    if (!parseJson(text, reply)) {
        syslog(LOG_ERR, "%s:%d Failed to parse %s, %m", __FILE_NAME__, __LINE__, text);
        _hasError = true;
        return false;
    }
    return true;
} catch (const std::bad_alloc&) {
    syslog(LOG_ERR, "%s:%d Failed to send content: has error", __FILE_NAME__, __LINE__);
    _hasError = true;
    return false;
}

}  // namespace TERN::HA::Daemon
