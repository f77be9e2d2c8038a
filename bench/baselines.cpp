#include "baselines.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <glob.h>
#include <netinet/in.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <ctime>

extern char** environ;

namespace baseline {

namespace {

constexpr std::size_t PIECE = 65536;

// Return the result of a call that must not fail.
template <class T>
T must(T value) {
    if (value < 0) {
        std::abort();
    }
    return value;
}

sockaddr_in addressOf(int port) {
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<std::uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    return address;
}

sockaddr_un addressOf(const char* path) {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, path);
    return address;
}

template <class Address>
const sockaddr* generic(const Address& address) {
    return reinterpret_cast<const sockaddr*>(&address);
}

}  // namespace

void appendLine(const char* path, const std::string& line) {
    std::time(nullptr);
    const int file = must(open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0666));
    must(write(file, line.data(), line.size()));
    close(file);
}

void moveLines(const char* from, const char* to) {
    const int output = must(open(to, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0666));
    const int input = must(open(from, O_RDONLY | O_CLOEXEC));
    static std::array<char, 2 * PIECE> buffer;
    std::size_t kept = 0;
    for (ssize_t count = 0; (count = must(read(input, buffer.data() + kept, PIECE))) > 0;) {
        const char* begin = buffer.data();
        const char* const end = begin + kept + count;
        const void* newline = nullptr;
        while ((newline = std::memchr(begin, '\n', static_cast<std::size_t>(end - begin))) != nullptr) {
            const char* const next = static_cast<const char*>(newline) + 1;
            must(write(output, begin, static_cast<std::size_t>(next - begin)));
            begin = next;
        }
        kept = static_cast<std::size_t>(end - begin);
        std::memmove(buffer.data(), begin, kept);
    }
    close(input);
    close(must(open(from, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666)));
    close(output);
}

void askPeer(int port, const char* question) {
    const int fd = must(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    const timeval timeout = {3, 0};
    must(setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout));
    const sockaddr_in address = addressOf(port);
    must(sendto(fd, question, std::strlen(question), 0, generic(address), sizeof address));
    std::array<char, 64> answer;
    must(recvfrom(fd, answer.data(), answer.size() - 1, 0, nullptr, nullptr));
    close(fd);
}

int peerSocket(int port) {
    const int fd = must(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    const sockaddr_in address = addressOf(port);
    must(bind(fd, generic(address), sizeof address));
    return fd;
}

void answerPeer(int socket, const char* answer) {
    std::array<char, 64> question;
    sockaddr_in from = {};
    socklen_t size = sizeof from;
    must(
        recvfrom(socket, question.data(), question.size() - 1, 0, reinterpret_cast<sockaddr*>(&from), &size));
    must(sendto(socket, answer, std::strlen(answer), 0, generic(from), size));
}

int controlSocket(const char* path) {
    const int fd = must(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const sockaddr_un address = addressOf(path);
    unlink(path);
    must(bind(fd, generic(address), sizeof address));
    must(listen(fd, 100));
    return fd;
}

void askControl(const char* path, const std::string& request) {
    const int fd = must(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const sockaddr_un address = addressOf(path);
    must(connect(fd, generic(address), sizeof address));
    must(send(fd, request.data(), request.size(), MSG_NOSIGNAL));
    std::array<char, 2096> reply;
    must(recv(fd, reply.data(), reply.size() - 1, 0));
    close(fd);
}

void answerControl(int socket, const std::string& reply) {
    const int fd = must(accept4(socket, nullptr, nullptr, SOCK_CLOEXEC));
    std::array<char, 2096> request;
    must(recv(fd, request.data(), request.size() - 1, 0));
    must(send(fd, reply.data(), reply.size(), MSG_NOSIGNAL));
    close(fd);
}

bool containsAny(const char* path, const std::vector<std::string>& words) {
    const int file = must(open(path, O_RDONLY | O_CLOEXEC));
    static std::array<char, 2 * PIECE> text;
    std::size_t size = 0;
    for (ssize_t count = 0; (count = must(read(file, text.data() + size, text.size() - size))) > 0;) {
        size += static_cast<std::size_t>(count);
    }
    close(file);
    bool isFound = false;
    for (const std::string& word : words) {
        isFound = isFound || memmem(text.data(), size, word.data(), word.size()) != nullptr;
    }
    return isFound;
}

void readEach(const char* pattern, const char* member) {
    glob64_t matches = {};
    must(-glob64(pattern, 0, nullptr, &matches));
    for (std::size_t i = 0; i < matches.gl_pathc; ++i) {
        std::array<char, 256> path;
        std::strcpy(path.data(), matches.gl_pathv[i]);
        std::strcat(path.data(), member);
        const int file = must(open(path.data(), O_RDONLY | O_CLOEXEC));
        std::array<char, 64> value;
        must(read(file, value.data(), value.size()));
        close(file);
    }
    globfree64(&matches);
}

void runTrue() {
    std::array<int, 2> ends;
    must(pipe2(ends.data(), O_CLOEXEC));
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, ends[1], STDOUT_FILENO);
    std::string program = "/bin/true";
    std::array<char*, 2> argv = {program.data(), nullptr};
    pid_t child = 0;
    must(-posix_spawn(&child, program.c_str(), &actions, nullptr, argv.data(), environ));
    posix_spawn_file_actions_destroy(&actions);
    close(ends[1]);
    close(ends[0]);
    must(waitpid(child, nullptr, 0));
}

std::string readAll(const char* path) {
    const int file = must(open(path, O_RDONLY | O_CLOEXEC));
    std::string text;
    std::array<char, PIECE> piece;
    for (ssize_t count = 0; (count = must(read(file, piece.data(), piece.size()))) > 0;) {
        text.append(piece.data(), static_cast<std::size_t>(count));
    }
    close(file);
    return text;
}

}  // namespace baseline
