#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <sstream>

#include "support/sandbox.h"
#include "ternhad/daemon.h"
#include "ternhad/played_peer.h"

namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;
using ::testing::Not;

constexpr char STATUS_SOCKET[] = "/run/ternha/status.sock";

class StatusSocketTest : public ::testing::Test {
 protected:
    void SetUp() override {
        if (!test::hasOtherUsers()) {
            GTEST_SKIP() << "needs users other than root";
        }
    }

    static test::Process start(const std::string& statusSocket = STATUS_SOCKET) {
        test::Process daemon(test::daemonArguments(
            "127.0.0.1", "127.0.0.2", "lo", {"--status-socket", statusSocket, "--status-group", "daemon"}));
        EXPECT_TRUE(test::eventually(10s, [] { return !test::statusAt().isNull(); })) << daemon.error();
        return daemon;
    }

    // What ternhactl prints on standard output and error, and its exit code, for a user and a group of the
    // same number; 1 is "daemon".
    static test::CommandResult runAs(int id, const std::string& arguments) {
        const std::string user = std::to_string(id);
        return test::run({"/bin/sh", "-c",
                          "exec 2>&1; setpriv --reuid " + user + " --regid " + user +
                              " --clear-groups " TERNHACTL " " + arguments});
    }
};

TEST_F(StatusSocketTest, ServesItsGroupAndRefusesReboots) {
    auto daemon = start();
    const std::string socket = std::string("--socket ") + STATUS_SOCKET;
    EXPECT_THAT(runAs(1, socket + " check").output, HasSubstr("TERNHA "));
    EXPECT_EQ(runAs(1, socket + " status --json").exitCode, 0);
    EXPECT_EQ(runAs(1, socket + " wait not-connected --timeout 30").exitCode, 0);
    const auto order = runAs(1, socket + " reboot-peer --yes");
    EXPECT_EQ(order.exitCode, 3);
    EXPECT_THAT(
        order.output,
        HasSubstr("ternhactl: ternhad on /run/ternha/status.sock refused: this socket is read-only\n"));
    EXPECT_THAT(runAs(1, "status").output, HasSubstr("Permission denied"));
    EXPECT_THAT(runAs(2, socket + " status").output, HasSubstr("Permission denied"));
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("Requesting a reboot of the peer")));
    daemon.signal(SIGTERM);
    EXPECT_TRUE(daemon.waitFor(10s).has_value());
    EXPECT_FALSE(test::exists(STATUS_SOCKET));
}

TEST_F(StatusSocketTest, PeerReceivesNothingButRequests) {
    auto daemon = start();
    const std::string socket = std::string("--socket ") + STATUS_SOCKET;
    for (int round = 0; round < 2; ++round) {
        {
            test::PlayedPeer peer;  // fails at whatever is no request
            EXPECT_EQ(runAs(1, socket + " wait peer-alive --timeout 30").exitCode, 0);
            EXPECT_EQ(runAs(1, socket + " wait peer-no-resync --timeout 30").exitCode, 0);
        }
        EXPECT_EQ(runAs(1, socket + " wait peer-dead --timeout 30").exitCode, 0);
    }
}

TEST_F(StatusSocketTest, DirectoryIsTraversableButNotListable) {
    auto daemon = start();
    EXPECT_EQ(test::run({"stat", "-c", "%a", "/run/ternha"}).output, "711\n");
    daemon.signal(SIGTERM);
    EXPECT_TRUE(daemon.waitFor(10s).has_value());
    // One that is not the daemon's stays as it is; one that it makes is passable, too.
    ASSERT_EQ(test::run({"mkdir", "-m", "700", "/run/private"}).exitCode, 0);
    for (const auto& [directory, mode] : {std::pair("/run/private", "700\n"), {"/run/monitoring", "711\n"}}) {
        auto another = start(directory + std::string("/status.sock"));
        const std::vector<std::string> stat = {"stat", "-c", "%a", directory};
        const std::string expected = mode;
        EXPECT_TRUE(test::eventually(10s, [&] { return test::run(stat).output == expected; })) << stat.back();
        another.signal(SIGTERM);
        EXPECT_TRUE(another.waitFor(10s).has_value());
    }
}

TEST_F(StatusSocketTest, DirectoryOfBothSocketsIsTraversable) {
    test::Process daemon(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo",
                                               {"--socket", "/run/both/control.sock", "--status-socket",
                                                "/run/both/status.sock", "--status-group", "daemon"}));
    EXPECT_TRUE(test::eventually(
        10s, [] { return runAs(1, "--socket /run/both/status.sock status --json").exitCode == 0; }));
    EXPECT_EQ(test::run({"stat", "-c", "%a", "/run/both"}).output, "711\n");
}

TEST_F(StatusSocketTest, DaemonRunsWithoutItUntilItCanBeCreated) {
    auto daemon = start("/run/missing/below/status.sock");
    EXPECT_TRUE(test::eventually(10s, [&] {
        return daemon.error().find(
                   "cannot bind the status socket /run/missing/below/status.sock: No such file "
                   "or directory; trying again\n") != std::string::npos;
    })) << daemon.error();
    test::makeDirectories("/run/missing/below");
    EXPECT_TRUE(
        test::eventually(20s, [] { return !test::statusAt("/run/missing/below/status.sock").isNull(); }));
    EXPECT_EQ(test::run({"stat", "-c", "%a %G", "/run/missing/below/status.sock"}).output, "660 daemon\n");
    EXPECT_TRUE(test::eventually(10s, [] {
        return test::wholeLog().find(" Created the socket /run/missing/below/status.sock\n") !=
               std::string::npos;
    }));
    EXPECT_THAT(test::wholeLog(), Not(HasSubstr("Recreated")));
    EXPECT_FALSE(test::statusAt().isNull());
}

TEST_F(StatusSocketTest, FollowersDoNotCountAgainstTheControlSocket) {
    auto daemon = start();
    const std::vector<std::string> follow = {TERNHACTL, "--socket", STATUS_SOCKET, "wait", "peer-alive"};
    std::vector<test::Process> followers;
    for (int i = 0; i < 16; ++i) {
        followers.emplace_back(follow);
    }
    // One more; or a few, if one of those came after it.
    bool isRefused = false;
    for (int i = 0; i < 16 && !isRefused; ++i) {
        test::Process another(follow);
        if (another.waitFor(5s)) {
            EXPECT_THAT(another.error(), HasSubstr("refused: too many clients follow the events\n"));
            isRefused = true;
        }
        followers.push_back(std::move(another));
    }
    EXPECT_TRUE(isRefused);
    EXPECT_EQ(runAs(0, "wait not-connected --timeout 20").exitCode, 0);
    EXPECT_EQ(runAs(0, "wait peer-alive --timeout 0.2").exitCode, 1);
}

}  // namespace
