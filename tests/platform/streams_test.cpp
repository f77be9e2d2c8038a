#include <sys/resource.h>

#include <csignal>
#include <set>
#include <thread>

#include "platform_test.h"

namespace platform_test {
namespace {

using ::testing::IsNull;
using ::testing::NotNull;

class StreamsTest : public test::SandboxTest {};

TEST_F(StreamsTest, ReadTheStandardOutputOnly) {
    const Output output = outputOf({"/bin/sh", "-c", "echo first; echo error >&2; echo second"});
    EXPECT_EQ(output.text, "first\nsecond\n");
    EXPECT_EQ(output.status, 0);
}

TEST_F(StreamsTest, PassTheArgumentVectorWithoutAShell) {
    EXPECT_EQ(outputOf({"/usr/bin/printf", "%s|", "a b", "", "$HOME", "*; exit 1"}).text,
              "a b||$HOME|*; exit 1|");
    const Arguments arguments = {"name", "-c", "tr '\\0' '|' < /proc/$$/cmdline"};
    FILE* const stream = PLATPopenv("/bin/sh", "r", arguments.vector());
    ASSERT_THAT(stream, NotNull());
    char line[64] = {};
    EXPECT_STREQ(std::fgets(static_cast<char*>(line), sizeof line, stream),
                 "name|-c|tr '\\0' '|' < /proc/$$/cmdline|");
    EXPECT_EQ(PLATPclose(stream), 0);
}

TEST_F(StreamsTest, PcloseReturnsTheRawWaitStatus) {
    EXPECT_EQ(outputOf({"/bin/sh", "-c", "exit 1"}).status, 256);
    EXPECT_EQ(outputOf({"/bin/sh", "-c", "exit 255"}).status, 255 * 256);
    EXPECT_EQ(outputOf({"/bin/sh", "-c", "kill -KILL $$"}).status, SIGKILL);
    EXPECT_EQ(outputOf({"/bin/sh", "-c", "kill -TERM $$"}).status, SIGTERM);
}

TEST_F(StreamsTest, PcloseWaitsForTheProgram) {
    const Arguments arguments = {"/bin/sh", "-c", "exec > /dev/null; sleep 0.3; echo done > /tmp/done"};
    FILE* const stream = PLATPopenv(arguments.path(), "r", arguments.vector());
    ASSERT_THAT(stream, NotNull());
    EXPECT_EQ(std::fgetc(stream), EOF);
    EXPECT_EQ(PLATPclose(stream), 0);
    EXPECT_TRUE(test::exists("/tmp/done"));
    EXPECT_TRUE(hasNoChild());
}

TEST_F(StreamsTest, ReadMoreThanThePipeCapacity) {
    std::string expected;
    for (int number = 1; number <= 100000; ++number) {
        expected += std::to_string(number) + "\n";
    }
    const Output output = outputOf({"/usr/bin/seq", "1", "100000"});
    EXPECT_TRUE(output.text == expected) << output.text.size() << " bytes instead of " << expected.size();
    EXPECT_EQ(output.status, 0);
}

TEST_F(StreamsTest, ClosingEarlyEndsTheProgramBySigpipe) {
    ASSERT_NE(std::signal(SIGPIPE, SIG_IGN), SIG_ERR);
    const Arguments arguments = {"/usr/bin/yes"};
    FILE* const stream = PLATPopenv(arguments.path(), "r", arguments.vector());
    ASSERT_THAT(stream, NotNull());
    char line[8] = {};
    EXPECT_STREQ(std::fgets(static_cast<char*>(line), sizeof line, stream), "y\n");
    EXPECT_EQ(PLATPclose(stream), SIGPIPE);
}

TEST_F(StreamsTest, WriteToTheStandardInput) {
    const Arguments arguments = {"/bin/sh", "-c", "cat > /tmp/copy; exit 2"};
    FILE* const stream = PLATPopenv(arguments.path(), "w", arguments.vector());
    ASSERT_THAT(stream, NotNull());
    const std::string text(200000, 'x');
    EXPECT_EQ(std::fwrite(text.data(), 1, text.size(), stream), text.size());
    EXPECT_EQ(std::fputs("end", stream), 1);
    EXPECT_EQ(PLATPclose(stream), 2 * 256);
    EXPECT_TRUE(test::readFile("/tmp/copy") == text + "end");
}

TEST_F(StreamsTest, AreNullWhenTheProgramCannotStart) {
    test::writeFile("/tmp/text", "#!/bin/sh\n");
    const struct {
        const char* path;
        int expected;
    } cases[] = {{"/bin/no-such-program", ENOENT},
                 {"/tmp/text/program", ENOTDIR},
                 {"", ENOENT},
                 {"/tmp", EACCES},
                 {"/dev/null", EACCES},
                 {"/tmp/text", EACCES}};
    for (const auto& item : cases) {
        for (const char* const mode : {"r", "w"}) {
            SCOPED_TRACE(std::string(mode) + " " + item.path);
            const char* const argv[] = {item.path, nullptr};
            errno = 0;
            EXPECT_THAT(PLATPopenv(item.path, mode, argv), IsNull());
            EXPECT_EQ(errno, item.expected);
        }
    }
    EXPECT_TRUE(hasNoChild());
}

TEST_F(StreamsTest, AreNullForInvalidArguments) {
    const char* const argv[] = {"/bin/true", nullptr};
    const char* const empty[] = {nullptr};
    for (const char* const mode : {"", "rw", "r+", "a", "x", static_cast<const char*>(nullptr)}) {
        errno = 0;
        EXPECT_THAT(PLATPopenv(argv[0], mode, argv), IsNull());
        EXPECT_EQ(errno, EINVAL);
    }
    for (const char* const* const vector :
         {static_cast<const char* const*>(empty), static_cast<const char* const*>(nullptr)}) {
        errno = 0;
        EXPECT_THAT(PLATPopenv(argv[0], "r", vector), IsNull());
        EXPECT_EQ(errno, EINVAL);
    }
    errno = 0;
    EXPECT_THAT(PLATPopenv(nullptr, "r", argv), IsNull());
    EXPECT_EQ(errno, EINVAL);
}

TEST_F(StreamsTest, AreNullWithoutFreeDescriptors) {
    rlimit before = {};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
    rlimit limit = before;
    limit.rlim_cur = 0;
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
    const char* const argv[] = {"/bin/true", nullptr};
    errno = 0;
    FILE* const stream = PLATPopenv(argv[0], "r", argv);
    const int error = errno;
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_THAT(stream, IsNull());
    EXPECT_EQ(error, EMFILE);
    EXPECT_TRUE(hasNoChild());
}

TEST_F(StreamsTest, PcloseRejectsAForeignStream) {
    FILE* const file = std::tmpfile();
    ASSERT_THAT(file, NotNull());
    errno = 0;
    EXPECT_EQ(PLATPclose(file), -1);
    EXPECT_EQ(errno, EINVAL);
    EXPECT_EQ(std::fputs("still open", file), 1);
    EXPECT_EQ(std::fclose(file), 0);
    EXPECT_EQ(PLATPclose(nullptr), -1);
}

TEST_F(StreamsTest, PcloseRejectsAClosedStream) {
    const Arguments arguments = {"/bin/true"};
    FILE* const stream = PLATPopenv(arguments.path(), "r", arguments.vector());
    ASSERT_THAT(stream, NotNull());
    EXPECT_EQ(PLATPclose(stream), 0);
    EXPECT_EQ(PLATPclose(stream), -1);
}

TEST_F(StreamsTest, MayBeClosedInAnyOrder) {
    std::vector<FILE*> streams;
    for (const char* const code : {"1", "2", "3"}) {
        const Arguments arguments = {"/bin/sh", "-c", std::string("exit ") + code};
        streams.push_back(PLATPopenv(arguments.path(), "r", arguments.vector()));
        ASSERT_THAT(streams.back(), NotNull());
    }
    EXPECT_EQ(PLATPclose(streams[1]), 2 * 256);
    EXPECT_EQ(PLATPclose(streams[2]), 3 * 256);
    EXPECT_EQ(PLATPclose(streams[0]), 1 * 256);
}

TEST_F(StreamsTest, OfConcurrentThreadsAreSeparate) {
    constexpr int THREADS = 8;
    constexpr int RUNS = 25;
    std::vector<std::thread> threads;
    threads.reserve(THREADS);
    for (int thread = 0; thread < THREADS; ++thread) {
        threads.emplace_back([thread] {
            for (int run = 0; run < RUNS; ++run) {
                const std::string token = std::to_string(thread) + "-" + std::to_string(run);
                const int code = (thread + run) % 5;
                const std::string exit = "exit " + std::to_string(code);
                const Output output = outputOf({"/bin/sh", "-c", "echo " + token + "; " + exit});
                EXPECT_EQ(output.text, token + "\n");
                EXPECT_EQ(output.status, code * 256);
                EXPECT_EQ(PLATExec("/bin/sh", "-c", exit.c_str(), nullptr) == 0, code == 0);
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_TRUE(hasNoChild());
}

// Closes standard descriptors for the lifetime of the object.
class WithoutDescriptors {
 public:
    explicit WithoutDescriptors(const std::set<int>& descriptors) {
        std::fflush(nullptr);
        for (const int fd : descriptors) {
            _copies.emplace_back(fd, fcntl(fd, F_DUPFD_CLOEXEC, 10));
            close(fd);
        }
    }
    WithoutDescriptors(const WithoutDescriptors&) = delete;
    WithoutDescriptors& operator=(const WithoutDescriptors&) = delete;
    ~WithoutDescriptors() {
        for (const auto& [fd, copy] : _copies) {
            dup2(copy, fd);
            close(copy);
        }
    }

 private:
    std::vector<std::pair<int, int>> _copies;
};

// The descriptors of streams may then be standard ones.
class MissingDescriptorsTest : public test::SandboxTest,
                               public ::testing::WithParamInterface<std::set<int>> {};

TEST_P(MissingDescriptorsTest, ReadTheStandardOutput) {
    Output output;
    {
        const WithoutDescriptors missing(GetParam());
        output = outputOf({"/bin/echo", "text"});
    }
    EXPECT_EQ(output.text, "text\n");
    EXPECT_EQ(output.status, 0);
}

TEST_P(MissingDescriptorsTest, WriteToTheStandardInput) {
    const Arguments arguments = {"/bin/sh", "-c", "cat > /tmp/copy"};
    int status = -1;
    {
        const WithoutDescriptors missing(GetParam());
        FILE* const stream = PLATPopenv(arguments.path(), "w", arguments.vector());
        if (stream != nullptr) {
            std::fputs("text", stream);
            status = PLATPclose(stream);
        }
    }
    EXPECT_EQ(status, 0);
    EXPECT_EQ(test::readFile("/tmp/copy"), "text");
}

TEST_P(MissingDescriptorsTest, PipeEndsDoNotBecomeStandardDescriptors) {
    Output output;
    {
        const WithoutDescriptors missing(GetParam());
        output = outputOf({"/bin/ls", "/proc/self/fd"});
    }
    // Those of the test and the stream, and the lowest free one for the listing itself.
    std::set<int> expected = {0, 1, 2};
    for (const int fd : GetParam()) {
        expected.erase(fd);
    }
    expected.insert(STDOUT_FILENO);
    int free = 0;
    while (expected.count(free) != 0) {
        ++free;
    }
    expected.insert(free);
    std::string text;
    for (const int fd : expected) {
        text += std::to_string(fd) + "\n";
    }
    EXPECT_EQ(output.text, text);
    EXPECT_EQ(output.status, 0);
}

TEST_P(MissingDescriptorsTest, ExecRunsPrograms) {
    int good = -1;
    int bad = -1;
    int detached = -1;
    const Arguments arguments = {"/bin/true"};
    {
        const WithoutDescriptors missing(GetParam());
        good = PLATExec("/bin/true", nullptr);
        bad = PLATExec("/bin/false", nullptr);
        detached = PLATExecv(arguments.path(), arguments.vector(), 0);
    }
    EXPECT_EQ(good, 0);
    EXPECT_NE(bad, 0);
    EXPECT_EQ(detached, 0);
}

std::string nameOf(const ::testing::TestParamInfo<std::set<int>>& info) {
    std::string name;
    for (const int fd : info.param) {
        name += std::to_string(fd);
    }
    return name;
}

INSTANTIATE_TEST_SUITE_P(Without, MissingDescriptorsTest,
                         ::testing::Values(std::set<int>{0}, std::set<int>{1}, std::set<int>{2},
                                           std::set<int>{0, 1}, std::set<int>{0, 2}, std::set<int>{1, 2},
                                           std::set<int>{0, 1, 2}),
                         nameOf);

}  // namespace
}  // namespace platform_test
