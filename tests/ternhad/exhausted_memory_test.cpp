#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <string>

#include "support/sandbox.h"
#include "ternhad/machine.h"

namespace {

using namespace std::chrono_literals;
using test::Machine;

class ExhaustedMemoryTest : public ::testing::Test {
 protected:
    void SetUp() override {
        test::connect(a.node, "10.0.0.1", b.node, "10.0.0.2");
        std::vector<std::string> command = {"/usr/bin/env", "NO_MEMORY_WHILE=/tmp/no-memory",
                                            std::string("LD_PRELOAD=") + FAILING_MEMORY};
        const auto arguments = test::daemonArguments(a.address, a.peer, "eth1");
        command.insert(command.end(), arguments.begin(), arguments.end());
        a.daemon.emplace(a.node.start(command));
        b.start();
        // Without memory it could not start, nor would it try for long.
        EXPECT_TRUE(test::eventually(20s, [this] {
            return bothSee(true) && a.log().find("Started on") != std::string::npos;
        })) << a.daemon->error();
    }

    bool bothSee(bool alive) { return a.sees("isRemoteAlive", alive) && b.sees("isRemoteAlive", alive); }

    // Failed steps of the first node's daemon.
    int failedSteps() const {
        int count = 0;
        const std::string said = a.daemon->error();
        for (std::size_t at = 0; (at = said.find("a step failed", at)) != std::string::npos; ++at) {
            ++count;
        }
        return count;
    }

    Machine a{"node-a", "10.0.0.1", "10.0.0.2"};
    Machine b{"node-b", "10.0.0.2", "10.0.0.1"};
};

TEST_F(ExhaustedMemoryTest, TemporaryExhaustionEndsNothing) {
    a.write("/tmp/no-memory", "");
    // Few: a slow machine must not take so long that the daemon gives up.
    EXPECT_TRUE(test::eventually(20s, [this] { return failedSteps() > 5; })) << a.daemon->error();
    test::removeTree(a.node.path("/tmp/no-memory"));

    a.write("/sys/block/md0/md/sync_action", "resync\n");
    EXPECT_TRUE(test::eventually(20s, [this] {
        return bothSee(true) && a.sees("isMDResync", true) && b.sees("isRemoteMDResync", true);
    }));
    a.daemon->signal(SIGTERM);
    const auto status = a.daemon->waitFor(10s);
    ASSERT_TRUE(status.has_value());
    EXPECT_EQ(*status, 0);
}

// What it says would be old.
TEST_F(ExhaustedMemoryTest, LastingExhaustionEndsTheDaemon) {
    const test::Stopwatch stopwatch;
    a.write("/tmp/no-memory", "");
    const auto status = a.daemon->waitFor(60s);
    ASSERT_TRUE(status.has_value());
    EXPECT_TRUE(WIFSIGNALED(*status)) << *status;
    EXPECT_GE(stopwatch.elapsed(), 10s) << a.daemon->error();
}

}  // namespace
