#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "checker.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"

using namespace std::string_literals;
using TERN::HA::Daemon::getLocalHostname;
using TERN::HA::Daemon::isHadConstraints;
using test::removeTree;
using test::writeFile;
using ::testing::Each;

namespace {

constexpr const char* HOSTNAME_FILE = "/tmp/.ha.hostname.original";
constexpr const char* CONSTRAINT_TOOL = "/var/packages/FailoverPair/target/sbin/ternha";

class LocalHostnameTest : public test::SandboxTest {
 protected:
    void TearDown() override {
        EXPECT_EQ(test::bufferText(), "");
        SandboxTest::TearDown();
    }
};

TEST_F(LocalHostnameTest, KeepsTheTrailingNewline) {
    writeFile(HOSTNAME_FILE, "node-a\n");
    EXPECT_EQ(getLocalHostname(), "node-a\n");
}

TEST_F(LocalHostnameTest, IsTheWholeFileByteForByte) {
    std::string content = "\n a\0b\r\n\xff"s;
    content += std::string(4096 - content.size(), 'x');
    writeFile(HOSTNAME_FILE, content);
    EXPECT_EQ(getLocalHostname(), content);
}

TEST_F(LocalHostnameTest, MayBeOneByte) {
    writeFile(HOSTNAME_FILE, "n");
    EXPECT_EQ(getLocalHostname(), "n");
}

TEST_F(LocalHostnameTest, IsTruncatedTo4096Bytes) {
    const std::string content(4096, 'x');
    writeFile(HOSTNAME_FILE, content + "y");
    EXPECT_EQ(getLocalHostname(), content);
}

TEST_F(LocalHostnameTest, OnlyBeginningOfAHugeFileIsRead) {
    writeFile(HOSTNAME_FILE, "node-a");
    ASSERT_EQ(truncate(HOSTNAME_FILE, 50'000'000'000), 0);
    EXPECT_EQ(getLocalHostname(), "node-a" + std::string(4090, '\0'));
}

TEST_F(LocalHostnameTest, FifoDoesNotBlock) {
    ASSERT_EQ(mkfifo(HOSTNAME_FILE, 0600), 0);
    EXPECT_EQ(getLocalHostname(), "");
}

TEST_F(LocalHostnameTest, FifoIsNotRead) {
    ASSERT_EQ(mkfifo(HOSTNAME_FILE, 0600), 0);
    std::fstream writer(HOSTNAME_FILE, std::ios::in | std::ios::out);
    writer << "node-a" << std::flush;
    EXPECT_EQ(getLocalHostname(), "");
}

TEST_F(LocalHostnameTest, SymbolicLinkIsNotFollowed) {
    writeFile("/tmp/secret", "secret");
    ASSERT_EQ(symlink("/tmp/secret", HOSTNAME_FILE), 0);
    EXPECT_EQ(getLocalHostname(), "");
}

// Return the name as an unprivileged user reads it. An unprivileged sandbox maps no second user: it
// stays root.
std::string hostnameAsUser(uid_t user) {
    [[maybe_unused]] const int result = seteuid(user);
    std::string name = getLocalHostname();
    EXPECT_EQ(seteuid(0), 0);
    return name;
}

TEST_F(LocalHostnameTest, FileOwnedByRootIsReadByAnotherUser) {
    writeFile(HOSTNAME_FILE, "node-a");
    ASSERT_EQ(chmod(HOSTNAME_FILE, 0644), 0);
    EXPECT_EQ(hostnameAsUser(1000), "node-a");
}

TEST_F(LocalHostnameTest, FileOwnedByTheCallerIsRead) {
    writeFile(HOSTNAME_FILE, "node-a");
    if (chown(HOSTNAME_FILE, 1000, 1000) == 0) {
        EXPECT_EQ(hostnameAsUser(1000), "node-a");
    } else {
        EXPECT_EQ(getLocalHostname(), "node-a");
    }
}

TEST_F(LocalHostnameTest, FileOwnedByAnotherUserIsIgnored) {
    writeFile(HOSTNAME_FILE, "node-a");
    if (chown(HOSTNAME_FILE, 1000, 1000) != 0) {
        // An unprivileged sandbox maps no second user; /bin/true belongs to the unmapped root.
        ASSERT_EQ(mount("/bin/true", HOSTNAME_FILE, nullptr, MS_BIND, nullptr), 0);
    }
    EXPECT_EQ(getLocalHostname(), "");
}

TEST_F(LocalHostnameTest, IsReadAgainAfterAMissingFile) {
    EXPECT_EQ(getLocalHostname(), "");
    EXPECT_EQ(getLocalHostname(), "");
    writeFile(HOSTNAME_FILE, "node-a");
    EXPECT_EQ(getLocalHostname(), "node-a");
}

TEST_F(LocalHostnameTest, IsReadAgainAfterAnEmptyFile) {
    writeFile(HOSTNAME_FILE, "");
    EXPECT_EQ(getLocalHostname(), "");
    writeFile(HOSTNAME_FILE, "node-a");
    EXPECT_EQ(getLocalHostname(), "node-a");
}

TEST_F(LocalHostnameTest, NonEmptyNameIsCached) {
    writeFile(HOSTNAME_FILE, "node-a");
    EXPECT_EQ(getLocalHostname(), "node-a");
    writeFile(HOSTNAME_FILE, "pair1");
    EXPECT_EQ(getLocalHostname(), "node-a");
    removeTree(HOSTNAME_FILE);
    EXPECT_EQ(getLocalHostname(), "node-a");
}

TEST_F(LocalHostnameTest, DirectoryInPlaceOfTheFileYieldsNoName) {
    test::makeDirectories(HOSTNAME_FILE);
    EXPECT_EQ(getLocalHostname(), "");
    removeTree(HOSTNAME_FILE);
    writeFile(HOSTNAME_FILE, "node-a");
    EXPECT_EQ(getLocalHostname(), "node-a");
}

TEST_F(LocalHostnameTest, ConcurrentFirstCallsReturnTheSameName) {
    const std::string name(4096, 'n');
    writeFile(HOSTNAME_FILE, name);
    std::vector<std::string> names(8);
    std::vector<std::thread> threads;
    for (std::string& own : names) {
        threads.emplace_back([&own] { own = getLocalHostname(); });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_THAT(names, Each(name));
    EXPECT_EQ(getLocalHostname(), name);
}

class ConstraintsTest : public test::SandboxTest {
 protected:
    void TearDown() override {
        EXPECT_EQ(test::bufferText(), "");
        SandboxTest::TearDown();
    }
};

TEST_F(ConstraintsTest, ExistWhenTheToolSucceeds) {
    test::createProgram(CONSTRAINT_TOOL, "exit 0");
    EXPECT_TRUE(isHadConstraints());
}

TEST_F(ConstraintsTest, DoNotExistWhenTheToolFails) {
    for (const char* script : {"exit 1", "exit 2", "exit 255"}) {
        test::createProgram(CONSTRAINT_TOOL, script);
        EXPECT_FALSE(isHadConstraints()) << script;
    }
}

TEST_F(ConstraintsTest, DoNotExistWhenTheToolIsKilled) {
    test::createProgram(CONSTRAINT_TOOL, "kill -9 $$");
    EXPECT_FALSE(isHadConstraints());
}

TEST_F(ConstraintsTest, DoNotExistWithoutTheTool) {
    EXPECT_FALSE(isHadConstraints());
}

TEST_F(ConstraintsTest, DoNotExistWhenTheToolCannotBeRun) {
    test::createProgram(CONSTRAINT_TOOL, "exit 0");
    ASSERT_EQ(chmod(CONSTRAINT_TOOL, 0600), 0);
    EXPECT_FALSE(isHadConstraints());
}

TEST_F(ConstraintsTest, ToolGetsOneArgumentAndIsWaitedFor) {
    test::createProgram(CONSTRAINT_TOOL, R"(sleep 0.5; printf '%s\n' "$0" "$#" "$@" > /tmp/arguments)");
    EXPECT_TRUE(isHadConstraints());
    EXPECT_EQ(test::readFile("/tmp/arguments"), CONSTRAINT_TOOL + "\n1\n--local-has-constraint\n"s);
}

TEST_F(ConstraintsTest, ToolIsRunOnEveryCall) {
    test::createProgram(CONSTRAINT_TOOL, "exit 0");
    EXPECT_TRUE(isHadConstraints());
    test::createProgram(CONSTRAINT_TOOL, "exit 1");
    EXPECT_FALSE(isHadConstraints());
}

}  // namespace
