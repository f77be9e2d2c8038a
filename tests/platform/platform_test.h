#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <initializer_list>
#include <string>
#include <vector>

#include "support/files.h"
#include "support/sandbox.h"
#include "support/wait.h"
#include "terncore.h"

namespace platform_test {

constexpr std::chrono::seconds PATIENCE{30};

/// Owns a null-terminated argument vector.
class Arguments {
 public:
    Arguments(std::initializer_list<std::string> texts) : _texts(texts) {
        for (const std::string& text : _texts) {
            _pointers.push_back(text.c_str());
        }
        _pointers.push_back(nullptr);
    }
    Arguments(const Arguments&) = delete;
    Arguments& operator=(const Arguments&) = delete;

    const char* path() const { return _pointers.front(); }
    const char* const* vector() const { return _pointers.data(); }

 private:
    std::vector<std::string> _texts;
    std::vector<const char*> _pointers;
};

struct Output {
    std::string text;
    int status = -1;  ///< as PLATPclose gives it
};

/// Run a program with PLATPopenv and read its whole output.
inline Output outputOf(const Arguments& arguments) {
    FILE* const stream = PLATPopenv(arguments.path(), "r", arguments.vector());
    if (stream == nullptr) {
        return {"not started", -1};
    }
    Output output;
    for (int character = std::fgetc(stream); character != EOF; character = std::fgetc(stream)) {
        output.text.push_back(static_cast<char>(character));
    }
    output.status = PLATPclose(stream);
    return output;
}

/// Return whether this process has neither a running child nor a zombie.
inline bool hasNoChild() {
    return waitpid(-1, nullptr, WNOHANG) == -1 && errno == ECHILD;
}

/// Blocks a shell script at `Gate::PASS` until the test opens the gate.
class Gate {
 public:
    static constexpr char PASS[] = "read line < /tmp/gate";

    Gate() { EXPECT_EQ(mkfifo("/tmp/gate", 0600), 0); }

    /// Wait until the script reaches the gate; false on timeout.
    static bool open() {
        return test::eventually(PATIENCE, [] {
            const int fd = ::open("/tmp/gate", O_WRONLY | O_NONBLOCK | O_CLOEXEC);
            const bool isOpen = fd != -1 && write(fd, "\n", 1) == 1;
            if (fd != -1) {
                close(fd);
            }
            return isOpen;
        });
    }
};

}  // namespace platform_test
