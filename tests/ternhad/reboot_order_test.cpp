#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "ternhad/machine.h"

namespace {

using namespace std::chrono_literals;
using ::testing::EndsWith;
using ::testing::HasSubstr;

class RebootOrderTest : public ::testing::Test {
 protected:
    RebootOrderTest() { test::connect(a.node, "10.0.0.1", b.node, "10.0.0.2"); }

    test::CommandResult order() { return a.node.run({TERNHACTL, "reboot-peer", "--yes"}); }

    bool eventuallyLogs(const std::string& text) {
        return test::eventually(10s, [&] { return a.log().find(text + "\n") != std::string::npos; });
    }

    // What `ternhactl rebooting` prints.
    bool isRebooting(const std::string& reply) {
        const auto result = a.node.run({TERNHACTL, "rebooting"});
        return result.output == reply;
    }

    // Reboots a peer that is killed as soon as its trigger is written.
    void rebootObeyingPeer() {
        test::Process ordered = a.node.start({TERNHACTL, "reboot-peer", "--yes"});
        EXPECT_TRUE(test::eventually(20s, [this] {
            return test::exists(b.node.path("/proc/sysrq-trigger")) &&
                   test::readFile(b.node.path("/proc/sysrq-trigger")) == "b";
        }));
        b.daemon->signal(SIGKILL);
        const auto result = test::resultOf(std::move(ordered));
        EXPECT_EQ(result.exitCode, 0);
        const std::string end =
            "The peer went down, or the link to it. It counts as rebooting until it replies again.\n";
        EXPECT_THAT(result.output, EndsWith(end));
        EXPECT_TRUE(eventuallyLogs("Reboot of the peer: it went down"));
    }

    test::Machine a{"node-a", "10.0.0.1", "10.0.0.2"};
    test::Machine b{"node-b", "10.0.0.2", "10.0.0.1"};
};

// The peer's kernel is a file here: it takes the order, and nothing happens.
TEST_F(RebootOrderTest, PeerThatIgnoresItWasNotRebooted) {
    a.start();
    b.start();
    ASSERT_TRUE(test::eventually(20s, [this] { return a.sees("isRemoteAlive", true); }));
    test::Process ordered = a.node.start({TERNHACTL, "reboot-peer", "--yes"});
    EXPECT_TRUE(eventuallyLogs("Requesting a reboot of the peer, which is alive"));
    // Nobody else waits for it.
    EXPECT_TRUE(test::eventually(10s, [&] { return isRebooting("yes\n"); }));
    EXPECT_THAT(a.node.run({TERNHACTL, "check"}).output, HasSubstr("peer being rebooted"));
    const auto second = order();
    EXPECT_EQ(second.exitCode, 1);
    EXPECT_EQ(second.output, "The peer is being rebooted already. Nothing done.\n");

    const auto result = test::resultOf(std::move(ordered));
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_THAT(result.output, EndsWith("The peer still answers: it was not rebooted.\n"));
    EXPECT_TRUE(eventuallyLogs("Reboot of the peer: it still answers, not rebooted"));
    EXPECT_TRUE(test::eventually(10s, [&] { return isRebooting("no\n"); }));
}

TEST_F(RebootOrderTest, ObeyingPeerWentDownAndDeadPeerWasAlreadyDead) {
    a.start();
    b.start();
    ASSERT_TRUE(test::eventually(20s, [this] { return a.sees("isRemoteAlive", true); }));
    rebootObeyingPeer();

    const auto again = order();
    EXPECT_EQ(again.exitCode, 1);
    EXPECT_THAT(again.output, EndsWith("The peer was already dead: it may not have received the request.\n"));
    EXPECT_TRUE(eventuallyLogs("Reboot of the peer: it was already dead"));
}

TEST_F(RebootOrderTest, DeadPeerDoesNotCountAsRebootingAfterARequest) {
    a.start();
    ASSERT_TRUE(test::eventually(20s, [this] {
        return a.node.run({TERNHACTL, "wait", "peer-dead", "--timeout", "1"}).exitCode == 0;
    }));
    EXPECT_EQ(order().exitCode, 1);
    EXPECT_TRUE(eventuallyLogs("Reboot of the peer: it was already dead"));
    EXPECT_TRUE(isRebooting("no\n"));
}

TEST_F(RebootOrderTest, PeerThatHasNotRepliedYetIsNeitherDeadNorAlive) {
    a.start({"--dead-after", "60"});
    ASSERT_TRUE(test::eventually(20s, [this] { return a.node.run({TERNHACTL, "rebooting"}).exitCode == 1; }));
    const auto result = order();
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_THAT(result.output,
                EndsWith("The peer had not replied yet: it may not have received the request.\n"));
    EXPECT_TRUE(eventuallyLogs("Requesting a reboot of the peer, which has not replied yet"));
    EXPECT_TRUE(eventuallyLogs("Reboot of the peer: unknown, it had not replied yet"));
    EXPECT_THAT(a.node.run({TERNHACTL, "status", "--json=1"}).output,
                HasSubstr(R"("orderOutcome":"was-unknown")"));
    EXPECT_TRUE(isRebooting("no\n"));
}

// Long before it counts as dead.
TEST_F(RebootOrderTest, ObeyingPeerWentDownAlthoughNotYetDeclaredDead) {
    a.start({"--dead-after", "60"});
    b.start();
    ASSERT_TRUE(test::eventually(20s, [this] { return a.sees("isRemoteAlive", true); }));
    rebootObeyingPeer();
    EXPECT_TRUE(a.sees("isRemoteAlive", true));
    EXPECT_FALSE(test::eventually(7s, [&] { return !isRebooting("yes\n"); }));
    b.start();
    EXPECT_TRUE(test::eventually(30s, [&] { return isRebooting("no\n"); }));
}

}  // namespace
