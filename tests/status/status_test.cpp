#include "status.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <thread>

#include "support/files.h"
#include "support/json.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using namespace TERN::HA::Daemon;
using test::LogLine;
using test::parsed;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

class StatusTest : public test::SandboxTest {
 protected:
    Status status;
};

TEST_F(StatusTest, InitiallyOnlyDrbdIsConnected) {
    EXPECT_TRUE(status.isDRBDConnect);
    EXPECT_FALSE(status.isRemoteMDResync);
    EXPECT_FALSE(status.isRemoteDiskErrHandling);
    EXPECT_FALSE(status.isMDResync);
    EXPECT_FALSE(status.isDiskErrHandling);
    EXPECT_EQ(status.heartbeatPacketFailRate, 0);
    EXPECT_EQ(status.heartbeatLatency, 0);
    EXPECT_FALSE(status.isRemoteAlive());
    EXPECT_FALSE(status.isRemoteRebooting());
    EXPECT_EQ(status.getRemoteNodeState(), 0U);
    EXPECT_EQ(status.toJson(), parsed(R"({"isRemoteAlive":false,"isRemoteMDResync":false,
        "isRemoteDiskErrHandling":false,"isMDResync":false,"isDiskErrHandling":false,"isDRBDConnect":true,
        "heartbeatPacketFailRate":0.0,"heartbeatLatency":0.0,"diskErrorHandlingDisk":[],
        "diskErrorHandlingDiskRemote":[]})"));
}

TEST_F(StatusTest, JsonHasEveryField) {
    status.setRemoteAlive(true);
    status.isRemoteMDResync = true;
    status.isRemoteDiskErrHandling = true;
    status.isMDResync = true;
    status.isDiskErrHandling = true;
    status.isDRBDConnect = false;
    status.heartbeatPacketFailRate = 0.1F;
    status.heartbeatLatency = 2.5F;
    status.setErrHandlingDisk(parsed(R"(["sdb","sda"])"));
    status.setErrHandlingDiskRemote(parsed(R"(["sdc"])"));
    Json::Value expected = parsed(R"({"isRemoteAlive":true,"isRemoteMDResync":true,
        "isRemoteDiskErrHandling":true,"isMDResync":true,"isDiskErrHandling":true,"isDRBDConnect":false,
        "heartbeatLatency":2.5,"diskErrorHandlingDisk":["sda","sdb"],"diskErrorHandlingDiskRemote":["sdc"]})");
    expected["heartbeatPacketFailRate"] = static_cast<double>(0.1F);  // a float, widened
    const Json::Value json = status.toJson();
    EXPECT_EQ(json, expected);
    EXPECT_EQ(json["heartbeatLatency"].type(), Json::realValue);
    EXPECT_EQ(json["isMDResync"].type(), Json::booleanValue);
}

TEST_F(StatusTest, EachFlagHasItsOwnKey) {
    const std::pair<std::atomic<bool>*, const char*> flags[] = {
        {&status.isRemoteMDResync, "isRemoteMDResync"},
        {&status.isRemoteDiskErrHandling, "isRemoteDiskErrHandling"},
        {&status.isMDResync, "isMDResync"},
        {&status.isDiskErrHandling, "isDiskErrHandling"},
        {&status.isDRBDConnect, "isDRBDConnect"},
    };
    for (const auto& [flag, key] : flags) {
        const Json::Value before = status.toJson();
        *flag = !*flag;
        Json::Value expected = before;
        expected[key] = !before[key].asBool();
        EXPECT_EQ(status.toJson(), expected) << key;
    }
}

// ---- State of the peer ----

TEST_F(StatusTest, OnlyTransitionsAreLogged) {
    EXPECT_TRUE(status.setRemoteAlive(false));
    EXPECT_THAT(test::daemonLogMessages(), IsEmpty());
    EXPECT_TRUE(status.setRemoteAlive(true));
    EXPECT_TRUE(status.setRemoteAlive(true));
    EXPECT_TRUE(status.setRemoteAlive(false));
    EXPECT_TRUE(status.setRemoteAlive(false));
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(LogLine("status.cpp", "Remote server status changed to alive"),
                            LogLine("status.cpp", "Remote server status changed to dead")));
}

TEST_F(StatusTest, TransitionIsLoggedBeforeItIsStored) {
    ASSERT_EQ(mkfifo(test::BUFFER, 0600), 0);  // opening a FIFO blocks until it has a reader
    std::atomic<pid_t> thread{0};
    std::thread change([&] {
        thread = gettid();
        status.setRemoteAlive(true);
    });
    ASSERT_TRUE(test::eventually(10s, [&] { return thread != 0 && test::isAsleep(thread); }));
    EXPECT_FALSE(status.isRemoteAlive());
    EXPECT_THAT(test::messages(test::readFile(test::BUFFER)),
                ElementsAre(LogLine("status.cpp", "Remote server status changed to alive")));
    change.join();
    EXPECT_TRUE(status.isRemoteAlive());
}

TEST_F(StatusTest, SetRemoteAliveChangesOnlyTheAliveBit) {
    status.setRemoteAlive(true);
    EXPECT_TRUE(status.isRemoteAlive());
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive);
    status.setRemoteAlive(false);
    EXPECT_FALSE(status.isRemoteAlive());
    EXPECT_EQ(status.getRemoteNodeState(), 0U);
}

TEST_F(StatusTest, PendingRebootSurvivesAnAlivePeer) {
    status.addRemoteNodeState(NodeRebootPending);
    EXPECT_TRUE(status.isRemoteRebooting());
    status.setRemoteAlive(true);
    EXPECT_TRUE(status.isRemoteRebooting());
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive | NodeRebootPending);
}

TEST_F(StatusTest, AlivePeerClearsRebootingButNotPending) {
    status.addRemoteNodeState(NodeRebooting | NodeRebootPending);
    status.setRemoteAlive(true);
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive | NodeRebootPending);
}

TEST_F(StatusTest, RebootingIsClearedEvenIfThePeerWasNeverDead) {
    status.setRemoteAlive(true);
    status.addRemoteNodeState(NodeRebooting);
    EXPECT_TRUE(status.isRemoteRebooting());
    status.setRemoteAlive(true);
    EXPECT_FALSE(status.isRemoteRebooting());
}

TEST_F(StatusTest, DeadPeerKeepsTheRebootBits) {
    status.addRemoteNodeState(NodeAlive | NodeRebootPending | NodeRebooting);
    status.setRemoteAlive(false);
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebootPending | NodeRebooting);
}

TEST_F(StatusTest, SeveralBitsAreSetAndClearedAtOnce) {
    EXPECT_TRUE(status.addRemoteNodeState(NodeRebootPending | NodeRebooting));
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebootPending | NodeRebooting);
    EXPECT_TRUE(status.isRemoteNodeState(NodeAlive | NodeRebooting));  // any of them
    EXPECT_FALSE(status.isRemoteNodeState(NodeAlive));
    EXPECT_TRUE(status.delRemoteNodeState(NodeAlive));  // not set: nothing changes
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebootPending | NodeRebooting);
    status.delRemoteNodeState(NodeRebootPending | NodeRebooting);
    EXPECT_EQ(status.getRemoteNodeState(), 0U);
}

// ---- Disks ----

TEST_F(StatusTest, DisksAreSortedAndDeduplicated) {
    EXPECT_TRUE(status.setErrHandlingDisk(parsed(R"(["sdb","sda","sdb"])")));
    EXPECT_EQ(status.getErrHandlingDisk(), parsed(R"(["sda","sdb"])"));
    EXPECT_TRUE(status.setErrHandlingDiskRemote(parsed(R"(["sdaa","sdb","sdB"])")));
    EXPECT_EQ(status.getErrHandlingDiskRemote(), parsed(R"(["sdB","sdaa","sdb"])"));
    EXPECT_EQ(status.getErrHandlingDisk(), parsed(R"(["sda","sdb"])"));
}

TEST_F(StatusTest, NewDisksReplacePreviousOnes) {
    status.setErrHandlingDisk(parsed(R"(["sda","sdb"])"));
    status.setErrHandlingDisk(parsed(R"(["sdc"])"));
    EXPECT_EQ(status.getErrHandlingDisk(), parsed(R"(["sdc"])"));
}

TEST_F(StatusTest, ValueWithoutElementsIsAnEmptyArray) {
    for (const char* nothing : {"null", "[]", "{}", "\"sda\"", "7", "true"}) {
        status.setErrHandlingDisk(parsed(R"(["sda"])"));
        status.setErrHandlingDiskRemote(parsed(R"(["sda"])"));
        EXPECT_TRUE(status.setErrHandlingDisk(parsed(nothing)));
        EXPECT_TRUE(status.setErrHandlingDiskRemote(parsed(nothing)));
        EXPECT_EQ(status.getErrHandlingDisk(), Json::Value(Json::arrayValue)) << nothing;
        EXPECT_EQ(status.getErrHandlingDiskRemote(), Json::Value(Json::arrayValue)) << nothing;
    }
}

TEST_F(StatusTest, ElementsNotConvertibleToStringsAreSkipped) {
    EXPECT_TRUE(status.setErrHandlingDisk(parsed(R"(["sda",["sdb"],{"x":"sdc"},7,"sdd"])")));
    EXPECT_EQ(status.getErrHandlingDisk(), parsed(R"(["7","sda","sdd"])"));
}

TEST_F(StatusTest, NumbersBooleansAndNullAreConvertedToStrings) {
    status.setErrHandlingDisk(parsed(R"([7,true,null,-1])"));
    EXPECT_EQ(status.getErrHandlingDisk(), parsed(R"(["","-1","7","true"])"));
}

TEST_F(StatusTest, ObjectYieldsItsValues) {
    status.setErrHandlingDiskRemote(parsed(R"({"a":"sdb","b":"sda","c":"sdb"})"));
    EXPECT_EQ(status.getErrHandlingDiskRemote(), parsed(R"(["sda","sdb"])"));
}

// ---- Threads ----

TEST_F(StatusTest, ConcurrentUpdatesAreAtomic) {
    const Json::Value few = parsed(R"(["sda"])");
    const Json::Value many = parsed(R"(["sdb","sdc","sdd","sde"])");
    status.setErrHandlingDisk(few);
    constexpr int ROUNDS = 2000;
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([&, i] {
            for (int round = 0; round < ROUNDS; ++round) {
                status.setErrHandlingDisk((round + i) % 2 == 0 ? few : many);
                const Json::Value seen = status.getErrHandlingDisk();
                wrong += seen == few || seen == many ? 0 : 1;
            }
        });
    }
    for (const NodeState bit : {NodeAlive, NodeRebootPending, NodeRebooting}) {
        threads.emplace_back([&, bit] {
            for (int round = 0; round < ROUNDS; ++round) {
                status.addRemoteNodeState(bit);
                wrong += status.isRemoteNodeState(bit) ? 0 : 1;  // nobody else touches it
                status.delRemoteNodeState(bit);
                wrong += status.isRemoteNodeState(bit) ? 1 : 0;
            }
            status.addRemoteNodeState(bit);
        });
    }
    threads.emplace_back([&] {
        for (int round = 0; round < ROUNDS; ++round) {
            wrong += status.toJson().size() == 10 ? 0 : 1;
        }
    });
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(wrong, 0);
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive | NodeRebootPending | NodeRebooting);
}

}  // namespace
