#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <ostream>
#include <stdexcept>

#include "checker.h"
#include "support/programs.h"
#include "support/sandbox.h"

namespace {

static_assert(!std::is_copy_constructible_v<TERN::HA::Daemon::CommandPipe>);
static_assert(!std::is_copy_assignable_v<TERN::HA::Daemon::CommandPipe>);

using TERN::HA::Daemon::CommandPipe;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class CommandPipeTest : public test::SandboxTest {};

TEST_F(CommandPipeTest, ReadsOutputAndPassesArguments) {
    const char* const argv[] = {"/bin/echo", "a b", "$HOME", nullptr};
    {
        const CommandPipe pipe(argv);
        EXPECT_FALSE(pipe._failed);
        EXPECT_EQ(pipe._command, "/bin/echo");
        char line[512] = {};
        ASSERT_NE(std::fgets(line, sizeof line, pipe._fp), nullptr);
        EXPECT_STREQ(line, "a b $HOME\n");  // no shell
    }
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
}

TEST_F(CommandPipeTest, StartFailureIsLogged) {
    const char* const argv[] = {"/nowhere/program", nullptr};
    {
        const CommandPipe pipe(argv);
        EXPECT_TRUE(pipe._failed);
        EXPECT_EQ(pipe._fp, nullptr);
    }
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec command: /nowhere/program")));
}

TEST_F(CommandPipeTest, EmptyArgumentVectorFailsToStart) {
    const char* const argv[] = {nullptr};
    EXPECT_TRUE(CommandPipe(argv)._failed);
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("checker.cpp", "Failed to exec command: ")));
}

struct ExitStatus {
    const char* script;
    const char* status;
};

void PrintTo(const ExitStatus& exitStatus, std::ostream* stream) {
    *stream << exitStatus.script;
}

class ExitStatusTest : public CommandPipeTest, public ::testing::WithParamInterface<ExitStatus> {};

TEST_P(ExitStatusTest, IsLoggedAsRawWaitStatus) {
    test::createProgram("/opt/program", GetParam().script);
    const char* const argv[] = {"/opt/program", nullptr};
    CommandPipe{argv};
    EXPECT_THAT(
        test::daemonLogMessages(),
        ElementsAre(test::LogLine(
            "checker.cpp", std::string("Failed to exec /opt/program return code: ") + GetParam().status)));
}

INSTANTIATE_TEST_SUITE_P(Exits, ExitStatusTest,
                         ::testing::Values(ExitStatus{"exit 1", "256"}, ExitStatus{"exit 255", "65280"},
                                           ExitStatus{"kill -KILL $$", "9"},
                                           ExitStatus{"kill -TERM $$", "15"}));

TEST_F(CommandPipeTest, DestructorLogsExitStatusDuringUnwinding) {
    test::createProgram("/opt/program", "exit 2");
    const char* const argv[] = {"/opt/program", nullptr};
    try {
        const CommandPipe pipe(argv);
        throw std::runtime_error("on the way");
    } catch (const std::runtime_error&) {
        EXPECT_THAT(
            test::daemonLogMessages(),
            ElementsAre(test::LogLine("checker.cpp", "Failed to exec /opt/program return code: 512")));
    }
}

}  // namespace
