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

constexpr const char* kHostname = "/tmp/.ha.hostname.original";
constexpr const char* kTool = "/var/packages/FailoverPair/target/sbin/ternha";

class LocalHostnameTest : public test::SandboxTest {
 protected:
    void TearDown() override {
        EXPECT_EQ(test::bufferText(), "");
        SandboxTest::TearDown();
    }
};

TEST_F(LocalHostnameTest, KeepsTheLineEnd) {
    writeFile(kHostname, "node-a\n");
    EXPECT_EQ(getLocalHostname(), "node-a\n");
}

TEST_F(LocalHostnameTest, IsTheWholeFileByteForByte) {
    std::string content = "\n a\0b\r\n\xff"s;
    content += std::string(4096 - content.size(), 'x');
    writeFile(kHostname, content);
    EXPECT_EQ(getLocalHostname(), content);
}

TEST_F(LocalHostnameTest, MayBeOneByte) {
    writeFile(kHostname, "n");
    EXPECT_EQ(getLocalHostname(), "n");
}

TEST_F(LocalHostnameTest, EndsAfter4096Bytes) {
    const std::string content(4096, 'x');
    writeFile(kHostname, content + "y");
    EXPECT_EQ(getLocalHostname(), content);
}

TEST_F(LocalHostnameTest, HugeSparseFileCostsNoMoreThanItsBeginning) {
    writeFile(kHostname, "node-a");
    ASSERT_EQ(truncate(kHostname, 50'000'000'000), 0);
    EXPECT_EQ(getLocalHostname(), "node-a" + std::string(4090, '\0'));
}

TEST_F(LocalHostnameTest, AFifoIsNotWaitedFor) {
    ASSERT_EQ(mkfifo(kHostname, 0600), 0);
    EXPECT_EQ(getLocalHostname(), "");
}

TEST_F(LocalHostnameTest, AFifoIsNotRead) {
    ASSERT_EQ(mkfifo(kHostname, 0600), 0);
    std::fstream writer(kHostname, std::ios::in | std::ios::out);
    writer << "node-a" << std::flush;
    EXPECT_EQ(getLocalHostname(), "");
}

TEST_F(LocalHostnameTest, ALinkIsNotFollowed) {
    writeFile("/tmp/secret", "secret");
    ASSERT_EQ(symlink("/tmp/secret", kHostname), 0);
    EXPECT_EQ(getLocalHostname(), "");
}

// What an ordinary user of the machine reads. In a sandbox of one, no other user is known: it stays root.
std::string hostnameAsUser(uid_t user) {
    [[maybe_unused]] const int result = seteuid(user);
    std::string name = getLocalHostname();
    EXPECT_EQ(seteuid(0), 0);
    return name;
}

TEST_F(LocalHostnameTest, AUserTakesAFileOfRoot) {
    writeFile(kHostname, "node-a");
    ASSERT_EQ(chmod(kHostname, 0644), 0);
    EXPECT_EQ(hostnameAsUser(1000), "node-a");
}

TEST_F(LocalHostnameTest, AUserTakesAFileOfItsOwn) {
    writeFile(kHostname, "node-a");
    if (chown(kHostname, 1000, 1000) == 0) {
        EXPECT_EQ(hostnameAsUser(1000), "node-a");
    } else {
        EXPECT_EQ(getLocalHostname(), "node-a");
    }
}

TEST_F(LocalHostnameTest, AFileOfAnotherUserIsNotTaken) {
    writeFile(kHostname, "node-a");
    if (chown(kHostname, 1000, 1000) != 0) {
        // No other user is known in a sandbox of an ordinary one, but the machine's root owns this.
        ASSERT_EQ(mount("/bin/true", kHostname, nullptr, MS_BIND, nullptr), 0);
    }
    EXPECT_EQ(getLocalHostname(), "");
}

TEST_F(LocalHostnameTest, IsLookedForAgainWhileTheFileIsMissing) {
    EXPECT_EQ(getLocalHostname(), "");
    EXPECT_EQ(getLocalHostname(), "");
    writeFile(kHostname, "node-a");
    EXPECT_EQ(getLocalHostname(), "node-a");
}

TEST_F(LocalHostnameTest, IsLookedForAgainWhileTheFileIsEmpty) {
    writeFile(kHostname, "");
    EXPECT_EQ(getLocalHostname(), "");
    writeFile(kHostname, "node-a");
    EXPECT_EQ(getLocalHostname(), "node-a");
}

TEST_F(LocalHostnameTest, OnceReadIsKept) {
    writeFile(kHostname, "node-a");
    EXPECT_EQ(getLocalHostname(), "node-a");
    writeFile(kHostname, "pair1");
    EXPECT_EQ(getLocalHostname(), "node-a");
    removeTree(kHostname);
    EXPECT_EQ(getLocalHostname(), "node-a");
}

TEST_F(LocalHostnameTest, IsEmptyWhileADirectoryIsInTheWay) {
    test::makeDirectories(kHostname);
    EXPECT_EQ(getLocalHostname(), "");
    removeTree(kHostname);
    writeFile(kHostname, "node-a");
    EXPECT_EQ(getLocalHostname(), "node-a");
}

TEST_F(LocalHostnameTest, ManyThreadsMayAskFirst) {
    const std::string name(4096, 'n');
    writeFile(kHostname, name);
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
    test::createProgram(kTool, "exit 0");
    EXPECT_TRUE(isHadConstraints());
}

TEST_F(ConstraintsTest, DoNotExistWhenTheToolFails) {
    for (const char* script : {"exit 1", "exit 2", "exit 255"}) {
        test::createProgram(kTool, script);
        EXPECT_FALSE(isHadConstraints()) << script;
    }
}

TEST_F(ConstraintsTest, DoNotExistWhenTheToolIsKilled) {
    test::createProgram(kTool, "kill -9 $$");
    EXPECT_FALSE(isHadConstraints());
}

TEST_F(ConstraintsTest, DoNotExistWithoutTheTool) {
    EXPECT_FALSE(isHadConstraints());
}

TEST_F(ConstraintsTest, DoNotExistWhenTheToolCannotBeRun) {
    test::createProgram(kTool, "exit 0");
    ASSERT_EQ(chmod(kTool, 0600), 0);
    EXPECT_FALSE(isHadConstraints());
}

TEST_F(ConstraintsTest, TheToolGetsOneArgumentAndItsEndIsAwaited) {
    test::createProgram(kTool, R"(sleep 0.5; printf '%s\n' "$0" "$#" "$@" > /tmp/arguments)");
    EXPECT_TRUE(isHadConstraints());
    EXPECT_EQ(test::readFile("/tmp/arguments"), kTool + "\n1\n--local-has-constraint\n"s);
}

TEST_F(ConstraintsTest, TheToolIsAskedOnEveryCall) {
    test::createProgram(kTool, "exit 0");
    EXPECT_TRUE(isHadConstraints());
    test::createProgram(kTool, "exit 1");
    EXPECT_FALSE(isHadConstraints());
}

}  // namespace
