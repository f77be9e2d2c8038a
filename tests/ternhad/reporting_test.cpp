#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <atomic>
#include <map>
#include <mutex>
#include <sstream>
#include <thread>

#include "support/sandbox.h"
#include "support/udp.h"
#include "ternhad/machine.h"

namespace {

using namespace std::chrono_literals;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::Not;

// What ternhactl prints on standard output and error, and its exit code.
test::CommandResult control(const std::string& arguments) {
    return test::run({"/bin/sh", "-c", "exec 2>&1; " TERNHACTL " " + arguments});
}

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

// The other end of the peer protocol, with replies that a test sets.
class Peer {
 public:
    Peer() : _thread([this] { serve(); }) {}
    ~Peer() {
        _isStopping = true;
        test::UdpSocket("127.0.0.2").send("", "127.0.0.2", 7499);
        _thread.join();
    }

    void setDisks(const std::string& reply) {
        const std::lock_guard<std::mutex> lock(_mutex);
        _disks = reply;
    }

 private:
    void serve() {
        test::UdpSocket socket("127.0.0.2", 7499);
        while (!_isStopping) {
            const auto request = socket.receive(60s);
            if (!request) {
                continue;
            }
            const std::lock_guard<std::mutex> lock(_mutex);
            const std::map<std::string, std::string> replies = {{"is_alive", "alive"},
                                                                {"is_md_resync", "not_resync"},
                                                                {"remote_hostname", "node-b\n"},
                                                                {"is_disk_err_handling", _disks}};
            const auto reply = replies.find(request->bytes);
            if (reply != replies.end()) {
                socket.send(reply->second, request->address, request->port);
            }
        }
    }

    std::mutex _mutex;
    std::string _disks = R"({"errHandlingDisk":[],"isDiskErrHandling":false})";
    std::atomic<bool> _isStopping{false};
    std::thread _thread;
};

TEST_F(ReportingTest, AReportOfTooManyDisksLeavesNoNames) {
    Peer peer;
    peer.setDisks(R"({"errHandlingDisk":["sda"],"isDiskErrHandling":true})");
    auto daemon = start();
    EXPECT_TRUE(test::eventually(10s, [] { return control("disks").output == "peer: sda\n"; }));
    EXPECT_THAT(control("metrics").output, HasSubstr(R"(ternha_disk_error{owner="peer",device="sda"} 1)"));

    peer.setDisks(R"({"errHandlingDisk":["sdb","sdc","sdd"],"isDiskErrHandling":true})");
    EXPECT_TRUE(test::eventually(
        10s, [] { return control("disks").output == "peer: more disks than a report holds\n"; }));
    EXPECT_THAT(control("status").output, HasSubstr(", more disks than a report holds\n"));
    EXPECT_THAT(control("metrics").output, Not(HasSubstr(R"(owner="peer")")));
    EXPECT_TRUE(report()["peer"]["disks"].isNull());
    EXPECT_TRUE(test::statusAt()["isRemoteDiskErrHandling"].asBool());

    peer.setDisks(R"({"errHandlingDisk":[],"isDiskErrHandling":false})");
    EXPECT_TRUE(test::eventually(10s, [] { return control("disks").output.empty(); }));
}

TEST_F(ReportingTest, WhatWasNeverMeasuredIsUnknownAndWhatADeadPeerSaidLastKnown) {
    auto daemon = start({"--dead-after", "1"});
    EXPECT_TRUE(test::eventually(10s, [] { return report()["peer"]["alive"]["value"] == false; }));
    EXPECT_TRUE(report()["peer"]["name"].isNull());
    EXPECT_TRUE(report()["peer"]["lastReply"].isNull());
    EXPECT_TRUE(report()["link"]["latency"]["value"].isNull());
    EXPECT_THAT(control("check").output, HasSubstr(" | latency=U;;;0 "));
    {
        Peer peer;
        EXPECT_TRUE(test::eventually(20s, [] { return report()["link"]["latency"]["value"].isDouble(); }));
        EXPECT_EQ(report()["peer"]["name"], "node-b");
        EXPECT_THAT(control("check").output, HasSubstr(" | latency=0."));
        EXPECT_THAT(control("status").output, HasSubstr(" <-> node-b: "));
    }
    EXPECT_TRUE(test::eventually(10s, [] { return report()["peer"]["alive"]["value"] == false; }));
    const std::string status = control("status").output;
    EXPECT_THAT(status, HasSubstr(", last reply "));
    EXPECT_THAT(status, HasSubstr("  RAID resync       no (last known, "));
    EXPECT_THAT(status, HasSubstr(" ms (last known, "));
    EXPECT_EQ(report()["peer"]["alive"]["changes"], 2);
    EXPECT_THAT(control("metrics").output, HasSubstr("ternha_transitions_total{flag=\"peer\"} 2\n"));
}

TEST_F(ReportingTest, BeforeTheFirstReplyThePeerIsUnknownNotDead) {
    auto daemon = start({"--dead-after", "30"});
    EXPECT_TRUE(test::eventually(10s, [] { return report()["node"]["resync"]["value"].isBool(); }));
    EXPECT_TRUE(report()["peer"]["alive"]["value"].isNull());
    EXPECT_THAT(control("check").output, HasSubstr("peer not probed yet"));
}

TEST_F(ReportingTest, AnInterfaceThatIsNotThereOrDownHasNoRate) {
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

TEST_F(ReportingTest, KernelFilesThatAreMissingAreLoggedOnceAndSeenWhenTheyAppear) {
    auto daemon = start({"--log-interval", "0.1"});
    const auto rounds = [](int wanted) {
        // A round of the checks reads the directories; the record of processes does not.
        test::UdpSocket("127.0.0.3").send("is_alive", "127.0.0.1", 7499);
        return test::eventually(60s, [=, n = 0]() mutable { return report().isObject() && ++n >= wanted; });
    };
    EXPECT_TRUE(test::eventually(10s, [] {
        return test::wholeLog().find("No ATA ports that tell of error handling: no ") != std::string::npos;
    }));
    EXPECT_TRUE(rounds(40));
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

TEST_F(ReportingTest, TheStatusSocketServesItsGroupAndTakesNoOrders) {
    ASSERT_EQ(test::run({"/bin/sh", "-c", "chmod 711 /run"}).exitCode, 0);
    auto daemon = start({"--status-socket", "/run/status.sock", "--status-group", "daemon"});
    const std::string asDaemon = "setpriv --reuid 1 --regid 1 --clear-groups ";
    const auto run = [](const std::string& command) {
        return test::run({"/bin/sh", "-c", "exec 2>&1; " + command});
    };
    const std::string tool = TERNHACTL;
    EXPECT_THAT(run(asDaemon + tool + " --socket /run/status.sock check").output, HasSubstr("TERNHA "));
    EXPECT_EQ(run(asDaemon + tool + " --socket /run/status.sock status --json").exitCode, 0);
    EXPECT_EQ(run(asDaemon + tool + " --socket /run/status.sock wait not-connected --timeout 30").exitCode,
              0);
    const auto order = run(asDaemon + tool + " --socket /run/status.sock reboot-peer --yes");
    EXPECT_EQ(order.exitCode, 3);
    EXPECT_THAT(order.output, HasSubstr("refused: this socket takes no orders\n"));
    EXPECT_THAT(run(asDaemon + tool + " status").output, HasSubstr("Permission denied"));
    EXPECT_THAT(
        run("setpriv --reuid 2 --regid 2 --clear-groups " + tool + " --socket /run/status.sock status")
            .output,
        HasSubstr("Permission denied"));
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("Reboot of the peer ordered")));
    daemon.signal(SIGTERM);
    EXPECT_TRUE(daemon.waitFor(10s).has_value());
    EXPECT_FALSE(test::exists("/run/status.sock"));
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

TEST_F(ReportingTest, ARequestThatIsNestedTooDeepIsRefused) {
    auto daemon = start();
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::string(test::CONTROL_SOCKET).copy(static_cast<char*>(address.sun_path), sizeof address.sun_path - 1);
    const test::Descriptor client(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0), "cannot make a socket");
    ASSERT_EQ(connect(client.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    const std::string request(2000, '[');
    ASSERT_EQ(send(client.get(), request.data(), request.size(), 0), 2000);
    char reply = 0;
    EXPECT_EQ(recv(client.get(), &reply, 1, 0), 0);
    EXPECT_EQ(daemon.error().find("a step failed"), std::string::npos) << daemon.error();
    EXPECT_FALSE(test::statusAt().isNull());
}

TEST_F(ReportingTest, AFollowerThatDoesNotReadDelaysNobody) {
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

class RebootOrderTest : public ::testing::Test {
 protected:
    RebootOrderTest() { test::connect(a.node, "10.0.0.1", b.node, "10.0.0.2"); }

    test::CommandResult order() { return a.node.run({TERNHACTL, "reboot-peer", "--yes"}); }

    bool eventuallyLogs(const std::string& text) {
        return test::eventually(10s, [&] { return a.log().find(text + "\n") != std::string::npos; });
    }

    test::Machine a{"node-a", "10.0.0.1", "10.0.0.2"};
    test::Machine b{"node-b", "10.0.0.2", "10.0.0.1"};
};

// The peer's kernel is a file here: it takes the order, and nothing happens.
TEST_F(RebootOrderTest, APeerThatIgnoresItWasNotRebooted) {
    a.start();
    b.start();
    ASSERT_TRUE(test::eventually(20s, [this] { return a.sees("isRemoteAlive", true); }));
    test::Process ordered = a.node.start({TERNHACTL, "reboot-peer", "--yes"});
    EXPECT_TRUE(eventuallyLogs("Reboot of the peer ordered, which is alive"));
    // Nobody else waits for it.
    EXPECT_TRUE(test::eventually(10s, [this] {
        return a.node.run({TERNHACTL, "rebooting"}).output == "yes\n";
    }));
    EXPECT_THAT(a.node.run({TERNHACTL, "check"}).output, HasSubstr("peer being rebooted"));
    const auto second = order();
    EXPECT_EQ(second.exitCode, 1);
    EXPECT_EQ(second.output, "The peer is being rebooted already. Nothing done.\n");

    const auto result = test::resultOf(std::move(ordered));
    EXPECT_EQ(result.exitCode, 1);
    EXPECT_THAT(result.output, EndsWith("The peer still answers: it was not rebooted.\n"));
    EXPECT_TRUE(eventuallyLogs("Reboot of the peer: it still answers, not rebooted"));
    EXPECT_TRUE(test::eventually(10s, [this] {
        return a.node.run({TERNHACTL, "rebooting"}).output == "no\n";
    }));
}

TEST_F(RebootOrderTest, APeerThatObeysWentDownAndADeadOneWasDeadBefore) {
    a.start();
    b.start();
    ASSERT_TRUE(test::eventually(20s, [this] { return a.sees("isRemoteAlive", true); }));
    test::Process ordered = a.node.start({TERNHACTL, "reboot-peer", "--yes"});
    EXPECT_TRUE(test::eventually(20s, [this] {
        return test::exists(b.node.path("/proc/sysrq-trigger")) &&
               test::readFile(b.node.path("/proc/sysrq-trigger")) == "b";
    }));
    b.daemon->signal(SIGKILL);
    const auto result = test::resultOf(std::move(ordered));
    EXPECT_EQ(result.exitCode, 0);
    EXPECT_THAT(result.output,
                EndsWith("The peer went down. It counts as rebooting until it answers again.\n"));
    EXPECT_TRUE(eventuallyLogs("Reboot of the peer: it went down"));

    const auto again = order();
    EXPECT_EQ(again.exitCode, 1);
    EXPECT_THAT(again.output,
                EndsWith("The peer was already dead: nobody knows whether it heard the order.\n"));
    EXPECT_TRUE(eventuallyLogs("Reboot of the peer: it was already dead"));
}

}  // namespace
