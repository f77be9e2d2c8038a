#include <sys/stat.h>

#include "platform_test.h"

namespace platform_test {
namespace {

// Executable files that fail to execute.
class FailedExecTest : public test::SandboxTest {
 protected:
    void expectNotStarted(const std::string& content, int expectedErrno) {
        const Arguments arguments = {"/tmp/program"};
        test::writeFile(arguments.path(), content);
        ASSERT_EQ(chmod(arguments.path(), 0755), 0);

        errno = 0;
        EXPECT_EQ(PLATPopenv(arguments.path(), "r", arguments.vector()), nullptr);
        EXPECT_EQ(errno, expectedErrno);
        EXPECT_NE(PLATExec(arguments.path(), nullptr), 0);
        EXPECT_NE(PLATExecv(arguments.path(), arguments.vector(), 1), 0);
        EXPECT_NE(PLATExecv(arguments.path(), arguments.vector(), 0), 0);
        EXPECT_TRUE(hasNoChild());
    }
};

TEST_F(FailedExecTest, ReportsAFileOfUnknownFormat) {
    expectNotStarted("neither a program nor a script\n", ENOEXEC);
}

TEST_F(FailedExecTest, ReportsAMissingInterpreter) {
    expectNotStarted("#!/no/such/shell\n", ENOENT);
}

}  // namespace
}  // namespace platform_test
