#include "ternhad/unreliable_link.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "support/wait.h"
#include "ternhad/machine.h"

namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;
using ::testing::Not;

class UnreliableLinkTest : public ::testing::TestWithParam<unsigned int> {
 protected:
    // True when node A knows what is true of node B, and lives with it.
    bool isTrue() {
        const Json::Value status = a.status();
        return status.isObject() && status["isRemoteAlive"].asBool() &&
               status["isRemoteMDResync"].asBool() == isResync &&
               status["isRemoteDiskErrHandling"].asBool() == isDiskTrouble &&
               (status["diskErrorHandlingDiskRemote"].size() == 1) == isDiskTrouble;
    }

    void expectTruth() {
        EXPECT_TRUE(test::eventually(60s, [this] { return isTrue(); })) << a.status() << a.log();
        EXPECT_FALSE(test::eventually(4s, [this] { return !isTrue(); })) << a.status() << a.log();
    }

    void setResync(bool on) {
        b.write("/sys/block/md0/md/sync_action", on ? "resync\n" : "idle\n");
        isResync = on;
    }

    void setDiskTrouble(bool on) {
        b.write("/sys/class/ata_port/ata3/error_handling", on ? "1\n" : "0\n");
        isDiskTrouble = on;
    }

    test::Machine a{"node-a", "10.0.0.1", "10.0.0.2"};
    test::Machine b{"node-b", "10.0.0.2", "10.0.0.1"};
    bool isResync = false;
    bool isDiskTrouble = false;
};

TEST_P(UnreliableLinkTest, CausesNeitherWrongStateNorFalsePositive) {
    const test::UnreliableLink link(a.node, a.address, b.node, b.address, {10, 10, 5}, GetParam());
    for (test::Machine* machine : {&a, &b}) {
        machine->daemon.emplace(
            machine->node.start(test::daemonArguments(machine->address, machine->peer, "lo")));
    }
    expectTruth();
    for (const bool on : {true, false}) {
        setResync(on);
        expectTruth();
        setDiskTrouble(on);
        expectTruth();
    }
    EXPECT_THAT(a.log(), Not(HasSubstr("changed to dead")));
    EXPECT_THAT(b.log(), Not(HasSubstr("changed to dead")));
}

INSTANTIATE_TEST_SUITE_P(Seeds, UnreliableLinkTest, ::testing::Values(1U, 2U));

}  // namespace
