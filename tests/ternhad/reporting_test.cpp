#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <sstream>

#include "support/sandbox.h"
#include "support/udp.h"
#include "ternhad/control_tool.h"
#include "ternhad/machine.h"
#include "ternhad/played_peer.h"

namespace {

using namespace std::chrono_literals;
using test::control;
using ::testing::ContainsRegex;
using ::testing::HasSubstr;
using ::testing::Not;

Json::Value report() {
    Json::Value json;
    std::istringstream(control("status --json=1").output) >> json;
    return json;
}

std::size_t count(const std::string& text, const std::string& part) {
    std::size_t found = 0;
    for (std::size_t place = text.find(part); place != std::string::npos;
         place = text.find(part, place + 1)) {
        ++found;
    }
    return found;
}

// One daemon on 127.0.0.1 whose peer, 127.0.0.2, a test may play.
class ReportingTest : public ::testing::Test {
 protected:
    static test::Process start(const std::vector<std::string>& more = {},
                               const std::string& interface = "lo") {
        test::Process daemon(test::daemonArguments("127.0.0.1", "127.0.0.2", interface, more));
        EXPECT_TRUE(test::eventually(10s, [] { return !test::statusAt().isNull(); })) << daemon.error();
        return daemon;
    }
};

TEST_F(ReportingTest, ReportOfTooManyDisksLeavesNoNames) {
    test::PlayedPeer peer;
    peer.setReply("is_disk_err_handling", R"({"errHandlingDisk":["sda"],"isDiskErrHandling":true})");
    auto daemon = start();
    EXPECT_TRUE(test::eventually(10s, [] { return control("disks").output == "peer: sda\n"; }));
    EXPECT_THAT(control("metrics").output, HasSubstr(R"(ternha_disk_error{owner="peer",device="sda"} 1)"));

    peer.setReply("is_disk_err_handling",
                  R"({"errHandlingDisk":["sdb","sdc","sdd"],"isDiskErrHandling":true})");
    EXPECT_TRUE(test::eventually(
        10s, [] { return control("disks").output == "peer: more disks than a report holds\n"; }));
    EXPECT_THAT(control("status").output, HasSubstr(", more disks than a report holds\n"));
    EXPECT_THAT(control("metrics").output, Not(HasSubstr(R"(owner="peer")")));
    EXPECT_TRUE(report()["peer"]["disks"].isNull());
    EXPECT_TRUE(test::statusAt()["isRemoteDiskErrHandling"].asBool());

    peer.setReply("is_disk_err_handling", R"({"errHandlingDisk":[],"isDiskErrHandling":false})");
    EXPECT_TRUE(test::eventually(10s, [] { return control("disks").output.empty(); }));
}

TEST_F(ReportingTest, NeverMeasuredIsUnknownAndADeadPeersStateLastKnown) {
    auto daemon = start({"--dead-after", "1"});
    EXPECT_TRUE(test::eventually(10s, [] { return report()["peer"]["alive"]["value"] == false; }));
    EXPECT_EQ(control("disks").output, "peer: unknown\n");
    EXPECT_TRUE(report()["peer"]["name"].isNull());
    EXPECT_TRUE(report()["peer"]["lastReply"].isNull());
    EXPECT_TRUE(report()["link"]["latency"]["value"].isNull());
    EXPECT_THAT(control("check").output, HasSubstr(" | latency=U;;;0 "));
    {
        test::PlayedPeer peer;
        EXPECT_TRUE(test::eventually(20s, [] { return report()["link"]["latency"]["value"].isDouble(); }));
        EXPECT_EQ(report()["peer"]["name"], "node-b");
        EXPECT_THAT(control("check").output, HasSubstr(" | latency=0."));
        EXPECT_THAT(control("status").output, HasSubstr(" <-> node-b: "));
    }
    EXPECT_TRUE(test::eventually(10s, [] { return report()["peer"]["alive"]["value"] == false; }));
    const std::string status = control("status").output;
    EXPECT_THAT(status, HasSubstr(", last reply "));
    EXPECT_THAT(status, HasSubstr("  RAID resync       no (last known "));
    EXPECT_THAT(status, HasSubstr(" ms (last known "));
    EXPECT_EQ(report()["peer"]["alive"]["changes"], 2);
    EXPECT_THAT(control("metrics").output, HasSubstr("ternha_transitions_total{flag=\"peer\"} 2\n"));
}

// As when this node's own interface goes down, before the peer is dead.
TEST_F(ReportingTest, LatencyIsLastKnownAfterAFailedMeasurement) {
    test::PlayedPeer peer;
    auto daemon = start();
    const auto latency = [] { return report()["link"]["latency"]; };
    EXPECT_TRUE(test::eventually(20s, [&] { return latency()["value"].isDouble(); }));
    EXPECT_FALSE(latency()["stale"].asBool());
    test::replaceProgram("/bin/ping", "exit 2");
    EXPECT_TRUE(test::eventually(20s, [&] { return latency()["stale"].asBool(); }));
    EXPECT_TRUE(report()["peer"]["alive"]["value"].asBool());
    EXPECT_THAT(control("status").output, ContainsRegex("  latency  .* ms \\(last known [0-9]+ s ago\\)\n"));
    EXPECT_THAT(control("check").output, HasSubstr(" | latency=U;"));
    test::restoreProgram("/bin/ping");
    EXPECT_TRUE(test::eventually(20s, [&] { return !latency()["stale"].asBool(); }));
}

TEST_F(ReportingTest, BeforeTheFirstReplyThePeerIsUnknownNotDead) {
    auto daemon = start({"--dead-after", "30"});
    EXPECT_TRUE(test::eventually(10s, [] { return report()["node"]["resync"]["value"].isBool(); }));
    EXPECT_TRUE(report()["peer"]["alive"]["value"].isNull());
    EXPECT_THAT(control("check").output, HasSubstr("peer has not replied yet"));
}

TEST_F(ReportingTest, MissingOrDownInterfaceHasNoRate) {
    auto daemon = start({}, "eth9");
    EXPECT_THAT(daemon.error(),
                HasSubstr("there is no network interface eth9 (yet): its packet rate is unknown\n"));
    EXPECT_TRUE(report()["link"]["nonOkRate"]["value"].isNull());
    EXPECT_THAT(control("status").output, HasSubstr("non-OK packets    unknown\n"));
    for (const std::string command :
         {"link add eth9 type veth peer name eth8", "link set eth9 up", "link set eth8 up"}) {
        ASSERT_EQ(test::run({"/bin/sh", "-c", "ip " + command}).exitCode, 0);
    }
    const auto hasRate = [] { return report()["link"]["nonOkRate"]["value"].isDouble(); };
    EXPECT_TRUE(test::eventually(10s, hasRate));
    ASSERT_EQ(test::run({"ip", "link", "set", "eth9", "down"}).exitCode, 0);
    EXPECT_TRUE(test::eventually(10s, [&] { return !hasRate(); }));
    EXPECT_EQ(test::statusAt()["heartbeatPacketFailRate"].asDouble(), 0);
}

TEST_F(ReportingTest, MissingKernelFilesAreLoggedOnceAndFoundWhenTheyAppear) {
    auto daemon = start({"--log-interval", "0.1"});
    const auto rounds = [](int wanted) {
        // A round of the checks reads the directories; the record of processes does not.
        test::UdpSocket("127.0.0.3").send("is_alive", "127.0.0.1", 7499);
        return test::eventually(60s,
                                [=, n = 0]() mutable { return !test::statusAt().isNull() && ++n >= wanted; });
    };
    EXPECT_TRUE(test::eventually(10s, [] {
        return test::wholeLog().find("No ATA ports that tell of error handling: no ") != std::string::npos;
    }));
    EXPECT_TRUE(rounds(100));
    const std::string log = test::wholeLog();
    EXPECT_EQ(count(log, "No DRBD: no /proc/drbd\n"), 1U);
    EXPECT_EQ(count(log, "No md arrays with redundancy: no /sys/block/md*/md/sync_action\n"), 1U);
    EXPECT_THAT(log, Not(HasSubstr("Failed to")));
    EXPECT_THAT(control("status").output, HasSubstr("DRBD              not connected (no /proc/drbd)\n"));

    test::writeFile("/proc/drbd", " 0: cs:Connected ro:Primary/Secondary ds:UpToDate/UpToDate C r-----\n");
    test::writeFile("/sys/block/md0/md/sync_action", "resync\n");
    EXPECT_TRUE(test::eventually(10s, [] {
        return test::statusAt()["isDRBDConnect"].asBool() && test::statusAt()["isMDResync"].asBool();
    }));
    EXPECT_TRUE(
        test::eventually(10s, [] { return count(test::wholeLog(), "Found DRBD: /proc/drbd\n") == 1; }));
}

TEST_F(ReportingTest, ConnectionOfAnUnsupportedDrbdIsUnknown) {
    test::writeFile("/proc/drbd", "version: 9.1.7 (api:2/proto:110-121)\n");
    auto daemon = start();
    const std::string message = "DRBD 9.1.7 is not supported, 8.4 is\n";
    const auto isLogged = [&] { return count(test::wholeLog(), message) == 1; };
    EXPECT_TRUE(test::eventually(10s, isLogged));
    EXPECT_EQ(control("wait not-connected --timeout 1").exitCode, 1);
    EXPECT_TRUE(report()["link"]["connected"]["value"].isNull());
    EXPECT_FALSE(test::statusAt()["isDRBDConnect"].asBool());
    test::writeFile("/proc/drbd", "version: 8.4.11 (api:1/proto:86-101)\n 0: cs:Connected\n");
    EXPECT_EQ(control("wait connected --timeout 20").exitCode, 0);
    EXPECT_TRUE(isLogged());
}

TEST_F(ReportingTest, FollowersSeeEachChangeAndWaitersTheirCondition) {
    test::writeFile("/sys/block/md0/md/sync_action", "idle\n");
    auto daemon = start();
    ASSERT_EQ(control("wait no-resync --timeout 20").exitCode, 0);
    test::Process follower({TERNHACTL, "events"});
    test::Process json({TERNHACTL, "events", "--json"});
    test::Process waiter({TERNHACTL, "wait", "resync", "--timeout", "60"});
    // They follow once they have connected; a change before that would be part of the report.
    const auto connections = [] {
        return count(test::readFile("/proc/net/unix"), "/run/ternha/control.sock");
    };
    EXPECT_TRUE(test::eventually(10s, [&] { return connections() >= 4; }));
    test::writeFile("/sys/block/md0/md/sync_action", "resync\n");
    EXPECT_TRUE(test::eventually(
        10s, [&] { return follower.output().find(" resync (was no-resync)\n") != std::string::npos; }));
    EXPECT_TRUE(test::eventually(
        10s, [&] { return json.output().find(R"("new":"resync","old":"no-resync")") != std::string::npos; }));
    EXPECT_EQ(waiter.waitFor(10s), 0);
    EXPECT_EQ(control("wait no-resync --timeout 0.2").exitCode, 1);
    daemon.signal(SIGTERM);
    EXPECT_TRUE(follower.waitFor(10s).has_value());
    EXPECT_THAT(follower.error(), HasSubstr("the connection was closed"));
}

TEST_F(ReportingTest, RequestNestedTooDeepIsRefused) {
    auto daemon = start();
    const test::Descriptor client = test::connectedClient();
    const std::string request(2000, '[');
    ASSERT_EQ(send(client.get(), request.data(), request.size(), 0), 2000);
    char reply = 0;
    EXPECT_EQ(recv(client.get(), &reply, 1, 0), 0);
    EXPECT_EQ(daemon.error().find("a step failed"), std::string::npos) << daemon.error();
    EXPECT_FALSE(test::statusAt().isNull());
}

TEST_F(ReportingTest, FollowerThatDoesNotReadDelaysNobody) {
    test::writeFile("/sys/block/md0/md/sync_action", "idle\n");
    auto daemon = start();
    test::Process stopped({TERNHACTL, "events"});
    test::Process follower({TERNHACTL, "events"});
    ASSERT_EQ(control("wait no-resync --timeout 20").exitCode, 0);
    stopped.signal(SIGSTOP);
    for (int i = 0; i < 20; ++i) {
        test::writeFile("/sys/block/md0/md/sync_action", i % 2 == 0 ? "resync\n" : "idle\n");
        ASSERT_EQ(control(i % 2 == 0 ? "wait resync --timeout 20" : "wait no-resync --timeout 20").exitCode,
                  0);
    }
    EXPECT_TRUE(test::eventually(10s, [&] { return count(follower.output(), " resync (was ") >= 9; }));
    stopped.signal(SIGKILL);
}

}  // namespace
